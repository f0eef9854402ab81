// The reader of metadata files. Its checks run in a fixed order and the first that fails ends the
// read; whoever called decides what such a directory is. A scan runs it for every container of a
// class, so it copies nothing that it can move.
#include "Daemon/TSYLog.h"
#include "Daemon/TSYMetadata.h"
#include "Daemon/TSYMetadataKeys.h"
#include "Daemon/TSYPropertyList.h"

using platform::UUID;
using platform::Value;

namespace {

// What a missing value looks like in a message.
std::string text(const Value* value) {
  return value == nullptr ? "(null)" : value->description();
}

bool endsInComponents(std::string_view path, std::string_view components) {
  if (!path.ends_with(components)) return false;
  path.remove_suffix(components.size());
  return path.ends_with('/');
}

class MetadataReader {
 public:
  MetadataReader(const TSYURL& fileURL, const TSYUserIdentityRef& expected, bool checkClassPath,
                 TSYUserIdentityCache& cache)
      : fileURL_(fileURL), expected_(expected), checkClassPath_(checkClassPath), cache_(cache) {}

  TSYResult<TSYMetadata> read() {
    auto dictionary = TSY_dictionaryWithContentsOfURL(fileURL_);
    if (!dictionary) {
      return TSYFailure(TSYErrorCreate(TSYErrorReadFailed, dictionary.error(), TSYLogIt::yes,
                                       "Failed to read metadata at URL {}", fileURL_.path()));
    }
    dictionary_ = std::move(*dictionary);
    for (const auto check :
         {&MetadataReader::readIdentifier, &MetadataReader::readUUID, &MetadataReader::readClass,
          &MetadataReader::readOwner, &MetadataReader::readInfo, &MetadataReader::readAssetsName,
          &MetadataReader::checkClassPath}) {
      if (auto result = (this->*check)(); !result) return TSYFailure(std::move(result.error()));
    }
    return build();
  }

 private:
  template <typename... Arguments>
  std::unexpected<TSYError> invalid(TSYLocatedFormat<std::type_identity_t<Arguments>...> format,
                                    Arguments&&... arguments) const {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidMetadata, std::nullopt, TSYLogIt::yes, format,
                                     std::forward<Arguments>(arguments)...));
  }

  Value* find(std::string_view key) {
    const auto found = dictionary_.find(key);
    return found == dictionary_.end() ? nullptr : &found->second;
  }

  TSYResult<void> readIdentifier() {
    const Value* value = find(kTSYMetadataIdentifier);
    if (value == nullptr || value->asString() == nullptr) {
      return invalid("Invalid metadata Identifier: {} at {}", text(value), fileURL_.path());
    }
    identifier_ = *value->asString();
    return {};
  }

  TSYResult<void> readUUID() {
    const Value* value = find(kTSYMetadataUUID);
    if (value == nullptr || value->asString() == nullptr) {
      return invalid("Invalid metadata UUID String: {} at {}", text(value), fileURL_.path());
    }
    uuid_ = UUID::parse(*value->asString());
    if (!uuid_) return invalid("Invalid metadata UUID: {} at {}", text(value), fileURL_.path());
    return {};
  }

  TSYResult<void> readClass() {
    const Value* value = find(kTSYMetadataContentClass);
    if (value == nullptr || !value->isNumber()) {
      return invalid("Invalid metadata Class: {} at {}", text(value), fileURL_.path());
    }
    class_ = *value->unsignedOfNumber();
    if (!TSYIsContainerClass(class_)) {
      return invalid("Invalid metadata Content Class: {} at {}", static_cast<int64_t>(class_),
                     fileURL_.path());
    }
    return {};
  }

  TSYResult<void> readOwner() {
    if (!TSYUserIdentity::isUserIdentityRequiredForContainerClass(class_)) {
      owner_ = TSYUserIdentityCache::defaultUserIdentity();
      return {};
    }
    if (!expected_) {
      return invalid("Incorrect User Identity: {}, expecting: {} for {} at {}: {}",
                     text(find(kTSYMetadataUserIdentity)), "(null)", identifier_, fileURL_.path(),
                     uint64_t{TSYErrorSuccess});
    }
    const uid_t expectedUID = expected_->posixUIDForContainerClass(class_);
    const Value* persona = find(kTSYMetadataPersona);
    if (persona != nullptr && persona->unsignedOfNumber() != expectedUID) {
      return invalid("Incorrect UserId: {}, expecting: {} for {} at {}", text(persona), expectedUID,
                     identifier_, fileURL_.path());
    }
    const Value* plist = find(kTSYMetadataUserIdentity);
    if (plist == nullptr) {
      // Written before there were user identities: the uid that was checked above is the owner.
      owner_ = cache_.userIdentityForPersonalPersonaWithUID(expectedUID, expectedUID);
      return {};
    }
    return resolveOwner(*plist);
  }

  TSYResult<void> resolveOwner(const Value& plist) {
    auto identity = TSYUserIdentity::userIdentityWithPlist(plist, cache_);
    if (!identity) {
      return invalid("Invalid metadata User Identity: {} for {} at {}: {}", text(&plist),
                     identifier_, fileURL_.path(), identity.error().code());
    }
    owner_ = std::move(*identity);
    if (!owner_->isEqualToUserIdentity(*expected_)) {
      return invalid("Incorrect User Identity: {}, expecting: {} for {} at {}: {}", *owner_,
                     *expected_, identifier_, fileURL_.path(), uint64_t{TSYErrorSuccess});
    }
    return {};
  }

  TSYResult<void> readInfo() {
    Value* value = find(kTSYMetadataInfo);
    if (value == nullptr) return {};
    if (value->asDictionary() == nullptr) {
      return invalid("Invalid metadata Info: {} at {}", text(value), fileURL_.path());
    }
    info_ = std::make_shared<const Value::Dictionary>(std::move(*value->asDictionary()));
    return {};
  }

  TSYResult<void> readAssetsName() {
    const Value* value = find(kTSYMetadataUserManagedAssetsDirName);
    if (value == nullptr) return {};
    if (value->asString() == nullptr) {
      return invalid("Invalid metadata User Managed Dir Name String: {} at {}", text(value),
                     fileURL_.path());
    }
    assetsName_ = *value->asString();
    return {};
  }

  // A container of a class lies in the class directory of some base, transient or not: three levels
  // up from the container and down again by the class directory must lead to its parent.
  TSYResult<void> checkClassPath() {
    if (!checkClassPath_) return {};
    const TSYURL parent = fileURL_.deletingLastPathComponent().deletingLastPathComponent();
    const std::string_view directory = TSYContainerClassDirectory(class_);
    if (endsInComponents(parent.path(), directory)) return {};
    const TSYURL expected =
        parent.deletingLastPathComponent().deletingLastPathComponent().appending(directory);
    return invalid("Invalid metadata-URLs should match: {} : {}", fileURL_.path(), expected.path());
  }

  TSYResult<TSYMetadata> build() {
    auto identity = TSYConcreteContainerIdentity::containerIdentityWithUUID(
        uuid_, owner_, std::move(identifier_), class_);
    if (!identity) {
      return invalid("Could not create user identity from {}: {}", fileURL_.path(),
                     identity.error().code());
    }
    TSYMetadata metadata(*identity, std::move(info_), fileURL_.deletingLastPathComponent(),
                         std::move(assetsName_));
    if (TSYLogIsEnabled(TSYLogLevelDebug)) {
      if (metadata.info()) dictionary_.insert_or_assign(kTSYMetadataInfo, *metadata.info());
      TSYLogWrite(TSYLogLevelDebug, "[{}] Read metadata from [{}]: {} <= {}",
                  "readAndValidateMetadataAtFileUrl:forUserIdentity:checkClassPath:error:",
                  fileURL_.path(), metadata.description(), Value(dictionary_).description());
    }
    return metadata;
  }

  const TSYURL& fileURL_;
  const TSYUserIdentityRef& expected_;
  const bool checkClassPath_;
  TSYUserIdentityCache& cache_;

  Value::Dictionary dictionary_;
  std::string identifier_;
  std::optional<UUID> uuid_;
  TSYContainerClass class_ = 0;
  TSYUserIdentityRef owner_;
  TSYMetadata::Info info_;
  std::optional<std::string> assetsName_;
};

}  // namespace

TSYResult<TSYMetadata> TSYMetadata::readAndValidateMetadataAtUrl(
    const TSYURL& containerURL, const TSYUserIdentityRef& forUserIdentity, bool checkClassPath,
    TSYUserIdentityCache& cache) {
  return readAndValidateMetadataAtFileUrl(containerURL.appending(kTSYMetadataFileName),
                                          forUserIdentity, checkClassPath, cache);
}

TSYResult<TSYMetadata> TSYMetadata::readAndValidateMetadataAtFileUrl(
    const TSYURL& fileURL, const TSYUserIdentityRef& forUserIdentity, bool checkClassPath,
    TSYUserIdentityCache& cache) {
  return MetadataReader(fileURL, forUserIdentity, checkClassPath, cache).read();
}
