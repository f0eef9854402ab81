#include "Daemon/TSYMetadata.h"

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYMetadataKeys.h"
#include "Daemon/TSYPropertyList.h"

using platform::Value;

TSYMetadata::TSYMetadata(const TSYConcreteContainerIdentity& identity, Info info, const TSYURL& url,
                         std::optional<std::string> userManagedAssetsDirName)
    : userIdentity_(identity.userIdentity()),
      identifier_(identity.identifier()),
      uuid_(identity.uuid()),
      info_(std::move(info)),
      assetsName_(std::move(userManagedAssetsDirName)),
      containerClass_(static_cast<uint8_t>(identity.containerClass())) {
  setURL(url);
}

void TSYMetadata::setURL(const TSYURL& url) {
  setURL(std::make_shared<const std::string>(url.deletingLastPathComponent().path()),
         std::string(url.lastPathComponent()));
}

void TSYMetadata::setURL(std::shared_ptr<const std::string> directory, std::string name) {
  directory_ = std::move(directory);
  name_ = std::move(name);
}

// Both are asked for with every lookup, and are put together in one piece.
TSYURL TSYMetadata::url() const {
  return TSYURL(fmt::format("{}/{}", *directory_, name_));
}

TSYURL TSYMetadata::metadataFileURL() const {
  return TSYURL(fmt::format("{}/{}/{}", *directory_, name_, kTSYMetadataFileName));
}

TSYConcreteContainerIdentity TSYMetadata::containerIdentity() const {
  // Cannot fail: the fields came from an identity.
  return *TSYConcreteContainerIdentity::containerIdentityWithUUID(uuid_, userIdentity_, identifier_,
                                                                  containerClass_);
}

Value::Dictionary TSYMetadata::dictionary() const {
  Value::Dictionary dictionary;
  if (info_) dictionary.emplace(kTSYMetadataInfo, *info_);
  dictionary.emplace(kTSYMetadataContentClass, uint64_t{containerClass_});
  if (TSYUserIdentity::isUserIdentityRequiredForContainerClass(containerClass_)) {
    dictionary.emplace(kTSYMetadataUserIdentity, userIdentity_->plist());
  }
  dictionary.emplace(kTSYMetadataIdentifier, identifier_);
  dictionary.emplace(kTSYMetadataUUID, uuid_.string());
  dictionary.emplace(kTSYMetadataVersion, kTSYMetadataCurrentVersion);
  if (assetsName_) dictionary.emplace(kTSYMetadataUserManagedAssetsDirName, *assetsName_);
  return dictionary;
}

TSYResult<void> TSYMetadata::writeMetadataToDisk() const {
  return writeMetadataToFileURL(metadataFileURL());
}

TSYResult<void> TSYMetadata::writeMetadataToFileURL(const TSYURL& fileURL) const {
  const std::optional<TSYURL> staging =
      TSYGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(userIdentity_,
                                                                                  containerClass_);
  if (!staging) {
    return TSYFailure(TSYErrorCreate(TSYErrorWriteFailed, std::nullopt, TSYLogIt::yes,
                                     "Failed to write metadata dictionary to URL {} : {}:{}",
                                     "(null)", TSYPosixErrorDomain, ENOENT));
  }
  const TSYURL temporary =
      staging->appending(fmt::format("temp_metadata-{}.plist", uuid_.string()));
  const Value::Dictionary content = dictionary();
  if (TSYLogIsEnabled(TSYLogLevelDebug)) {
    TSYLogWrite(TSYLogLevelDebug, "[{}] Writing metadata to [{}]: {} => {}",
                "writeMetadataToFileURL:error:", fileURL.path(), description(),
                Value(content).description());
  }
  if (const auto written = TSY_writeToURL(content, temporary, kTSYWriteProtectionNone); !written) {
    return TSYFailure(TSYErrorCreate(TSYErrorWriteFailed, written.error(), TSYLogIt::yes,
                                     "Failed to write metadata dictionary to URL {} : {}:{}",
                                     temporary.path(), written.error().domain(),
                                     written.error().code()));
  }
  const auto moved = TSYFileManager::defaultManager().moveItemAtURL(temporary, fileURL);
  if (!moved) {
    return TSYFailure(TSYErrorCreate(TSYErrorWriteFailed, moved.error(), TSYLogIt::yes,
                                     "Failed to move metadata from staging: {} to final: {}",
                                     temporary.path(), fileURL.path()));
  }
  return {};
}

std::string TSYMetadata::description() const {
  return fmt::format(
      "<{}: {}; userIdentity = {}, uuid = {}, containerClass = {}, identifier = {}, info = {}, "
      "url = {}, userManagedAssetsDirName = {}>",
      "TSYMetadata", fmt::ptr(this), userIdentity_ ? userIdentity_->description() : "(null)",
      uuid_.string(), containerClass_, identifier_, info_ ? Value(*info_).description() : "(null)",
      url().path(), assetsName_.value_or("(null)"));
}
