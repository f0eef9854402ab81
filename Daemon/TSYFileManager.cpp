// Directories, copies, moves, removals, listings and protection classes.
#include "Daemon/TSYFileManager.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "Daemon/TSYLog.h"
#include "Platform/os/Platform.h"

namespace {

using platform::Errno;
using platform::FileDescriptor;
using platform::FileSystem;

FileSystem& files() {
  return platform::Platform::current().files;
}

platform::Result<void> makeDirectory(const std::string& path, bool withIntermediateDirectories,
                                     mode_t mode) {
  if (withIntermediateDirectories) return files().makePath(path, mode);
  auto made = files().makeDirectory(path, mode);
  if (!made && made.error() == Errno{EEXIST}) return {};
  return made;
}

TSYError creationError(const std::string& path, bool withIntermediateDirectories, Errno error) {
  return withIntermediateDirectories
             ? TSYPosixErrorCreate(error, "mkpath_np of {} failed: {}", path, error.message())
             : TSYPosixErrorCreate(error, "mkdir of {} failed: {}", path, error.message());
}

TSYError temporaryDirectoryError(const TSYURL& parent, const std::string& prefix, Errno error) {
  // As a template of mkdtemp(3) has it.
  const std::string name = prefix + std::string(/*random characters*/ 6, 'X');
  return TSYPosixErrorCreate(error, "Failed to create temp dir at path {} : {}",
                             parent.appending(name).path(), error.message());
}

// Whether an allowed missing source ends the operation.
TSYResult<bool> isMissing(const TSYURL& source) {
  const auto exists = files().exists(source.path());
  if (exists) return false;
  if (exists.error() == Errno{ENOENT}) return true;
  return TSYFailure(TSYPosixErrorCreate(exists.error(), "stat of {} failed: {}", source.path(),
                                        exists.error().message()));
}

// The removal of one tree, for the items that resist.
class Obstacles {
 public:
  explicit Obstacles(std::string rootPath) : rootPath_(std::move(rootPath)) {}

  std::optional<Errno> overcome(int parent, const std::string& name, const std::string& path,
                                Errno error) const {
    if (error == Errno{ENOENT}) return std::nullopt;
    TSYLogWrite(TSYLogLevelError, "removefile hit error for {} : {}", path, error.message());
    if (error != Errno{EPERM}) return error;
    struct stat status{};
    if (::fstatat(parent, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
      TSYLogWrite(TSYLogLevelError, "Failed to stat {} before unsetting UF_IMMUTABLE: {}", path,
                  Errno{errno}.message());
      return error;
    }
    if (!makeRemovable(parent, name, path)) return error;
    if (::unlinkat(parent, name.c_str(), S_ISDIR(status.st_mode) ? AT_REMOVEDIR : 0) == 0) {
      return std::nullopt;
    }
    const Errno remaining{errno};
    TSYLogWrite(TSYLogLevelError, "unlink of {} failed: {}", path, remaining.message());
    return remaining;
  }

 private:
  // Takes the flag away from the item, or from the directory that holds it fast: both block. The
  // directory that holds the whole tree is none of it and keeps its flag.
  bool makeRemovable(int parent, const std::string& name, const std::string& path) const {
    const bool item = clearImmutable(parent, name, path);
    const bool holder =
        path != rootPath_ && clearImmutable(parent, ".", path.substr(0, path.rfind('/')));
    return item || holder;
  }

  static bool clearImmutable(int parent, const std::string& name, const std::string& path) {
    const auto cleared = files().clearImmutableAt(parent, name);
    if (!cleared) {
      TSYLogWrite(TSYLogLevelError, "Failed to lchflags {}: {}", path, cleared.error().message());
      return false;
    }
    if (*cleared) TSYLogWrite(TSYLogLevelNotice, "Unset UF_IMMUTABLE on {}", path);
    return *cleared;
  }

  const std::string rootPath_;
};

TSYResult<FileDescriptor> openForClass(const std::string& path) {
  auto item = files().openItem(path);
  if (item) return std::move(*item);
  return TSYFailure(
      TSYPosixErrorCreate(item.error(), "Failed to open {} : {}", path, item.error().message()));
}

TSYResult<int> classOf(const FileDescriptor& item, const std::string& path) {
  const auto current = files().protectionClass(item.get());
  if (current) return *current;
  return TSYFailure(TSYPosixErrorCreate(current.error(), "Failed to getclass of file {}: {}", path,
                                        current.error().message()));
}

}  // namespace

TSYFileManager& TSYFileManager::defaultManager() {
  static TSYFileManager manager;
  return manager;
}

TSYResult<void> TSYFileManager::createDirectoryAtURL(const TSYURL& url,
                                                     bool withIntermediateDirectories, mode_t mode,
                                                     uid_t owner, int protectionClass) {
  const std::string& path = url.path();
  // Nearly every directory that is asked for is there already.
  auto directory = files().openDirectory(path);
  if (!directory) {
    if (directory.error() != Errno{ENOENT}) {
      return TSYFailure(creationError(path, withIntermediateDirectories, directory.error()));
    }
    const auto made = makeDirectory(path, withIntermediateDirectories, mode);
    if (!made) return TSYFailure(creationError(path, withIntermediateDirectories, made.error()));
    directory = files().openDirectory(path);
    if (!directory) {
      return TSYFailure(TSYPosixErrorCreate(directory.error(), "opendir of {} failed: {}", path,
                                            directory.error().message()));
    }
  }
  if (protectionClass != kUnchangedProtectionClass) {
    const auto set = files().setProtectionClass(directory->get(), protectionClass);
    if (!set) {
      return TSYFailure(TSYPosixErrorCreate(set.error(),
                                            "Failed to setclass({}) on directory {}: {}",
                                            protectionClass, path, set.error().message()));
    }
  }
  if (owner != kUnchangedOwner) {
    const auto set = files().setOwner(directory->get(), owner, owner);
    if (!set) {
      // Ids are shown signed: the nobody account is -2.
      const auto shown = static_cast<int32_t>(owner);
      return TSYFailure(TSYPosixErrorCreate(set.error(), "Failed to chown({},{}) {}: {}", shown,
                                            shown, path, set.error().message()));
    }
  }
  return {};
}

TSYResult<void> TSYFileManager::createDirectoryAtURL(const TSYURL& url,
                                                     bool withIntermediateDirectories,
                                                     mode_t mode) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, kUnchangedOwner,
                              kUnchangedProtectionClass);
}

TSYResult<void> TSYFileManager::copyItemAtURL(const TSYURL& source, const TSYURL& destination) {
  const auto copied = files().copy(source.path(), destination.path());
  if (copied) return {};
  return TSYFailure(TSYPosixErrorCreate(copied.error(), "copyfile of {} to {} failed: {}",
                                        source.path(), destination.path(),
                                        copied.error().message()));
}

TSYResult<void> TSYFileManager::renameItemAtURL(const TSYURL& source, const TSYURL& destination) {
  const auto renamed = files().rename(source.path(), destination.path());
  if (renamed) return {};
  return TSYFailure(TSYPosixErrorCreate(renamed.error(), "rename of {} to {} failed: {}",
                                        source.path(), destination.path(),
                                        renamed.error().message()));
}

TSYResult<void> TSYFileManager::moveItemAtURL(const TSYURL& source, const TSYURL& destination) {
  auto renamed = renameItemAtURL(source, destination);
  if (renamed || !renamed.error().isPosix(EXDEV)) return renamed;
  auto copied = copyItemAtURL(source, destination);
  if (!copied) return copied;
  const auto removed = removeItemAtURL(source);
  if (!removed) {
    TSYLogWrite(TSYLogLevelError, "Failed to remove move source after copy at {} : {}",
                source.path(), removed.error());
  }
  return {};
}

TSYResult<void> TSYFileManager::copyItemIfExistsAtURL(const TSYURL& source,
                                                      const TSYURL& destination) {
  const auto missing = isMissing(source);
  if (!missing) return TSYFailure(missing.error());
  return *missing ? TSYResult<void>() : copyItemAtURL(source, destination);
}

TSYResult<void> TSYFileManager::moveItemIfExistsAtURL(const TSYURL& source,
                                                      const TSYURL& destination) {
  const auto missing = isMissing(source);
  if (!missing) return TSYFailure(missing.error());
  return *missing ? TSYResult<void>() : moveItemAtURL(source, destination);
}

TSYResult<void> TSYFileManager::removeItemAtURL(const TSYURL& url) {
  if (url.path().empty()) {
    return TSYFailure(
        TSYPosixErrorCreate(Errno{EFAULT}, "nil url passed to -removeItemAtURL:error:"));
  }
  const Obstacles obstacles(url.path());
  const auto removed = files().remove(
      url.path(), [&](int parent, const std::string& name, const std::string& path, Errno error) {
        return obstacles.overcome(parent, name, path, error);
      });
  if (removed) return {};
  return TSYFailure(TSYPosixErrorCreate(removed.error(), "removefile of {} failed: {}", url.path(),
                                        removed.error().message()));
}

TSYResult<void> TSYFileManager::syncDirectoryOfItemAtURL(const TSYURL& url) {
  const TSYURL directory = url.deletingLastPathComponent();
  const auto synced = files().syncDirectory(directory.path());
  if (synced) return {};
  return TSYFailure(TSYPosixErrorCreate(synced.error(), "fsync of {} failed: {}", directory.path(),
                                        synced.error().message()));
}

void TSYFileManager::removeTemporaryFilesInDirectoryAtURL(const TSYURL& url) {
  const auto removed = files().removeTemporaryFiles(url.path());
  if (removed) return;
  TSYLogWrite(TSYLogLevelError, "Failed to remove temporary files in {}: {}", url.path(),
              removed.error().message());
}

TSYResult<TSYURL> TSYFileManager::createTemporaryDirectoryInDirectoryURL(
    const TSYURL& parent, const std::string& prefix) {
  auto made = files().makeTemporaryDirectory(parent.path(), prefix);
  if (made) return TSYURL(std::move(*made));
  return TSYFailure(temporaryDirectoryError(parent, prefix, made.error()));
}

TSYResult<TSYFileManager::OpenDirectory> TSYFileManager::createOpenTemporaryDirectoryInDirectoryURL(
    const TSYURL& parent, const std::string& prefix) {
  auto made = files().makeOpenTemporaryDirectory(parent.path(), prefix);
  if (made) {
    return OpenDirectory{.url = parent.appending(made->name),
                         .descriptor = std::move(made->directory)};
  }
  return TSYFailure(temporaryDirectoryError(parent, prefix, made.error()));
}

TSYResult<std::vector<TSYURL>> TSYFileManager::urlsForItemsInDirectoryAtURL(
    const TSYURL& directory) {
  const auto entries = files().list(directory.path());
  if (!entries) {
    const Errno error = entries.error();
    if (error != Errno{ENOENT}) {
      TSYLogWrite(TSYLogLevelError, "opendir of {} failed: {}", directory.path(), error.message());
    }
    return TSYFailure(TSYPosixErrorCreate(error, "_IterateDirectory for {} returned {}",
                                          directory.path(), error.message()));
  }
  std::vector<TSYURL> urls;
  urls.reserve(entries->size());
  for (const platform::DirectoryEntry& entry : *entries) {
    if (!entry.name.starts_with('.')) urls.push_back(directory.appending(entry.name));
  }
  return urls;
}

bool TSYFileManager::itemExistsAtURL(const TSYURL& url) {
  const auto exists = files().exists(url.path());
  if (!exists && exists.error() != Errno{ENOENT}) {
    TSYLogWrite(TSYLogLevelError, "Failed to determine if {} exists: {}", url.path(),
                exists.error().message());
  }
  return exists.has_value();
}

bool TSYFileManager::itemDoesNotExistAtURL(const TSYURL& url) {
  const auto exists = files().exists(url.path());
  if (exists) return false;
  if (exists.error() == Errno{ENOENT}) return true;
  TSYLogWrite(TSYLogLevelError, "Failed to determine if {} exists: {}", url.path(),
              exists.error().message());
  return false;
}

TSYResult<bool> TSYFileManager::directoryExistsAtURL(const TSYURL& url) {
  const auto status = files().status(url.path());
  if (status) return S_ISDIR(status->st_mode);
  const Errno error = status.error();
  for (const int missing : {ENOENT, ENOTDIR, ELOOP, ENAMETOOLONG}) {
    if (error.value == missing) return false;
  }
  TSYLogWrite(TSYLogLevelError, "Failed to determine if {} exists: {}", url.path(),
              error.message());
  return TSYFailure(
      TSYPosixErrorCreate(error, "stat of {} failed: {}", url.path(), error.message()));
}

TSYResult<int> TSYFileManager::dataProtectionClassOfItemAtURL(const TSYURL& url) {
  const auto item = openForClass(url.path());
  if (!item) return TSYFailure(item.error());
  return classOf(*item, url.path());
}

TSYResult<void> TSYFileManager::setDataProtectionClassOfItemAtURL(
    const TSYURL& url, int toClass, const ClassPredicate& ifPredicate) {
  const auto item = openForClass(url.path());
  if (!item) return TSYFailure(item.error());
  if (ifPredicate) {
    const auto current = classOf(*item, url.path());
    if (!current) return TSYFailure(current.error());
    if (!ifPredicate(*current)) return {};
  }
  const auto set = files().setProtectionClass(item->get(), toClass);
  if (set) return {};
  return TSYFailure(TSYPosixErrorCreate(set.error(), "Failed to setclass({}) on file {}: {}",
                                        toClass, url.path(), set.error().message()));
}
