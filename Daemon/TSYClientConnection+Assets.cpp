// The directory inside an application's data container for what its user manages.
//
// The container's owner may put a link or another item in the place of anything in it while a
// request runs. So a new directory is changed through its descriptor only. A path from a client is
// resolved first; the real path is then compared with the container's, and used without following
// links. A link put there later is not followed: the item is missed.
#include "Daemon/TSYCacheSteps.h"
#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYLocks.h"
#include "Platform/os/Platform.h"

namespace {

constexpr char kLibrary[] = "Library";
constexpr char kAssetsNamePrefix[] = "com.veltra.UserManagedAssets.";
constexpr mode_t kAssetsDirectoryMode = 0755;

TSYFileManager& fileManager() {
  return TSYFileManager::defaultManager();
}

TSYResult<TSYMetadataRef> lookUp(const TSYContainerIdentity& identity) {
  return TSYContainerCache::sharedInstance().containerForContainerIdentity(
      identity, /*transient=*/false, /*updateSandbox=*/true);
}

std::unexpected<TSYError> noAppDataContainer(const TSYContainerIdentity& identity,
                                             const TSYError& error) {
  return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, error, TSYLogIt::yes,
                                   "Failed to create app data container for user managed assets "
                                   "path for {}: {}",
                                   identity, error));
}

TSYURL libraryOf(const TSYMetadata& container) {
  return container.url().appending(kLibrary);
}

// The recorded name, when it can be one of a directory in Library: the container's owner can write
// the file that it comes from.
std::optional<std::string> recordedAssetsName(const TSYMetadata& container) {
  const auto& name = container.userManagedAssetsDirName();
  if (!name || name->empty() || *name == "." || *name == "..") return std::nullopt;
  if (name->find('/') != std::string::npos || name->find('\0') != std::string::npos) {
    return std::nullopt;
  }
  return name;
}

// The name of the directory that is there; none without one.
TSYResult<std::optional<std::string>> existingAssetsName(const TSYMetadata& container) {
  const auto name = recordedAssetsName(container);
  if (!name) return std::nullopt;
  const auto exists = fileManager().directoryExistsAtURL(libraryOf(container).appending(*name));
  if (!exists) return TSYFailure(exists.error());
  return *exists ? name : std::nullopt;
}

TSYResult<std::string> makeAssetsDirectory(const TSYMetadata& container) {
  const TSYURL library = libraryOf(container);
  const auto made =
      fileManager().createOpenTemporaryDirectoryInDirectoryURL(library, kAssetsNamePrefix);
  if (!made) {
    return TSYFailure(TSYErrorCreate(TSYErrorCreateDirectoryFailed, made.error(), TSYLogIt::yes,
                                     "Failed to create user managed assets dir at {}: {}",
                                     library.path(), made.error()));
  }
  const std::string& path = made->url.path();
  const auto& files = platform::Platform::current().files;
  const auto changed = files.setMode(made->descriptor.get(), kAssetsDirectoryMode);
  if (!changed) {
    return TSYFailure(TSYErrorCreate(TSYErrorCreateDirectoryFailed, std::nullopt, TSYLogIt::yes,
                                     "Failed to chmod user managed assets dir at {}: {}", path,
                                     changed.error().message()));
  }
  const TSYUserIdentity& owner = *container.userIdentity();
  const auto owned = files.setOwner(made->descriptor.get(),
                                    owner.posixUIDForContainerClass(container.containerClass()),
                                    owner.posixGIDForContainerClass(container.containerClass()));
  if (!owned) {
    return TSYFailure(TSYErrorCreate(TSYErrorCreateDirectoryFailed, std::nullopt, TSYLogIt::yes,
                                     "Failed to chown user managed assets dir at {}: {}", path,
                                     owned.error().message()));
  }
  return std::string(made->url.lastPathComponent());
}

// Makes the directory and records its name. It stays when recording it fails.
TSYResult<std::string> createAssets(TSYMetadata container) {
  auto name = makeAssetsDirectory(container);
  if (!name) return name;
  container.setUserManagedAssetsDirName(*name);
  if (auto written = container.writeMetadataToDisk(); !written) {
    return TSYFailure(std::move(written.error()));
  }
  // What a client keeps there must not be forgotten with the record.
  for (const TSYURL& made : {libraryOf(container).appending(*name), container.metadataFileURL()}) {
    if (auto synced = fileManager().syncDirectoryOfItemAtURL(made); !synced) {
      return TSYFailure(std::move(synced.error()));
    }
  }
  auto added = TSYAddToCache(container, container.url(), container.transient(),
                             /*updateSandbox=*/false);
  if (!added) return TSYFailure(std::move(added.error()));
  return name;
}

// The real path of the item that `relativePath` names in the assets directory.
TSYResult<TSYURL> assetToDelete(const TSYURL& directory, const std::string& relativePath) {
  const auto unresolvable = [](const TSYURL& resource, const TSYError& error) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidPath, error, TSYLogIt::yes,
                                     "Unable to get realpath for resource {}", resource.path()));
  };
  const auto realDirectory = fileManager().realPathOfItemAtURL(directory);
  if (!realDirectory) return unresolvable(directory, realDirectory.error());
  const auto outside = [&] {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidPath, std::nullopt, TSYLogIt::yes,
                                     "Illegal attempt to delete asset not residing in user managed "
                                     "assets directory {}",
                                     directory.path()));
  };
  // With a link on the way it is no assets directory, and may be anybody's.
  if (*realDirectory != directory) return outside();
  const TSYURL asset = directory.appending(relativePath);
  auto realAsset = fileManager().realPathOfItemAtURL(asset);
  if (!realAsset) return unresolvable(asset, realAsset.error());
  if (*realAsset == *realDirectory) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidPath, std::nullopt, TSYLogIt::yes,
                                     "Illegal attempt to delete user managed assets directory at "
                                     "{}",
                                     realAsset->path()));
  }
  if (!realAsset->isInside(*realDirectory)) return outside();
  return realAsset;
}

}  // namespace

TSYResult<TSYClientConnection::UserManagedAssets>
TSYClientConnection::userManagedAssetsPathWithContainerIdentity(
    const TSYContainerIdentity& identity, bool isRelative, bool createIfNecessary) {
  return TSYCatchingExceptions(
      [&] { return userManagedAssetsPath(identity, isRelative, createIfNecessary); });
}

TSYResult<TSYClientConnection::UserManagedAssets> TSYClientConnection::userManagedAssetsPath(
    const TSYContainerIdentity& identity, bool isRelative, bool createIfNecessary) {
  if (!entitled_ && identity.identifier() != clientBundleIdentifier()) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorInvalidArgument, std::nullopt, TSYLogIt::yes,
                       "{} trying to retrieve path for identifier: {} without entitlement",
                       clientBundleIdentifier(), identity.identifier()));
  }
  const auto found = lookUp(identity);
  if (!found) return noAppDataContainer(identity, found.error());
  const TSYIdentifierLock lock(TSYLockMode::writing, (*found)->uuid().string(),
                               /*useLocking=*/true);
  const auto container = TSYFindContainer((*found)->containerIdentity());
  if (!container) return noAppDataContainer(identity, container.error());

  auto existing = existingAssetsName(**container);
  if (!existing) return TSYFailure(std::move(existing.error()));
  if (!*existing && !createIfNecessary) {
    return TSYFailure(TSYErrorCreate(TSYErrorUserManagedPathNotFound, std::nullopt, TSYLogIt::no,
                                     "User managed path for {}:{} Not Found",
                                     *identity.userIdentity(), identity.identifier()));
  }
  auto name = *existing ? TSYResult<std::string>(**existing) : createAssets(**container);
  if (!name) return TSYFailure(std::move(name.error()));
  return UserManagedAssets{.path = isRelative ? fmt::format("{}/{}", kLibrary, *name)
                                              : libraryOf(**container).appending(*name).path(),
                           .existed = existing->has_value()};
}

uint64_t TSYClientConnection::deleteUserManagedAssetWithContainerIdentity(
    const TSYContainerIdentity& identity, const std::optional<std::string>& relativePath) {
  const auto deleted =
      TSYCatchingExceptions([&] { return deleteUserManagedAsset(identity, relativePath); });
  return deleted ? uint64_t{TSYErrorSuccess} : deleted.error().clientCode();
}

TSYResult<void> TSYClientConnection::deleteUserManagedAsset(
    const TSYContainerIdentity& identity, const std::optional<std::string>& relativePath) {
  if (!relativePath) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Can't act on invalid input: ID: {}, Path: {}", identity,
                                     "(null)"));
  }
  const auto found = lookUp(identity);
  if (!found) return noAppDataContainer(identity, found.error());
  const TSYIdentifierLock lock(TSYLockMode::writing, (*found)->uuid().string(),
                               /*useLocking=*/true);
  const auto container = TSYFindContainer((*found)->containerIdentity());
  if (!container) return noAppDataContainer(identity, container.error());
  const auto name = recordedAssetsName(**container);
  if (!name) {
    return TSYFailure(
        TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                       "No userManagedAssetsDirName or URL in container metadata object: {}",
                       (*container)->description()));
  }
  const auto asset = assetToDelete(libraryOf(**container).appending(*name), *relativePath);
  if (!asset) return TSYFailure(asset.error());
  const auto moved = _moveItemAtURLToDeathRow(*asset, /*startDeletionThread=*/false);
  if (moved) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorFileOperationFailed, moved.error(), TSYLogIt::yes,
                                   "Failed to remove asset at {}", asset->path()));
}
