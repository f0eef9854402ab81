// Create or look up: the central operation.
//
// A container is built in the staging directory of its class, under the name that it will have, and
// appears at its live path with one rename, the point of commitment. So what is visible there is
// always complete. What a failure leaves in staging goes to death row at once; what a crash leaves
// there is cleaned up at the next start.
#include <algorithm>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYDataProtectionManager.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYWhitelist.h"
#include "Platform/os/Accounts.h"
#include "Platform/os/Platform.h"
#include "Platform/os/Signpost.h"

using platform::Platform;
using platform::UUID;

namespace {

// The number in a container's info dictionary that says which protection class its content has.
constexpr char kContentProtectionClassKey[] = "com.veltra.Hatchery.ContentProtectionClass";

constexpr mode_t kDirectoryMode = 0755;
constexpr int kProtectionClassUnprotected = 0;

// The staging directory of a container that is being built. Unless it is committed, what is in it
// goes to death row, also when an exception passes.
class Staging {
 public:
  explicit Staging(TSYURL url) : url_(std::move(url)) {}
  ~Staging() {
    if (!over_ && TSYFileManager::defaultManager().itemExistsAtURL(url_)) (void)moveAway();
  }
  Staging(const Staging&) = delete;
  Staging& operator=(const Staging&) = delete;

  const TSYURL& url() const { return url_; }
  void commit() { over_ = true; }
  // The failure to return: the one given, unless what it left behind cannot be moved away.
  TSYError abandon(TSYError failure) {
    over_ = true;
    const auto moved = moveAway();
    if (moved) return failure;
    return TSYErrorCreate(TSYErrorStagingRemoveFailed, moved.error(), TSYLogIt::yes,
                          "Failed to remove staging dir: {}", url_.path());
  }

 private:
  TSYResult<void> moveAway() {
    return TSYClientConnection::_moveItemAtURLToDeathRow(url_, /*startDeletionThread=*/true);
  }

  const TSYURL url_;
  bool over_ = false;
};

// Whose the container is: of global classes the default user's, whoever asked for it, as it will be
// when its metadata file is read again.
TSYUserIdentityRef ownerOf(const TSYContainerIdentity& identity) {
  if (TSYUserIdentity::isUserIdentityRequiredForContainerClass(identity.containerClass())) {
    return identity.userIdentity();
  }
  const TSYUserIdentityRef defaultUser = TSYUserIdentityCache::defaultUserIdentity();
  return defaultUser ? defaultUser : identity.userIdentity();
}

// The owner of what is inside a container.
uid_t ownerOfContent(const TSYMetadata& metadata) {
  if (TSYIsSystemClass(metadata.containerClass())) return platform::kNobodyAccount;
  return metadata.userIdentity()->posixUIDForContainerClass(metadata.containerClass());
}

bool isExcludedFromUserData(const std::string& name) {
  const auto& excluded = TSYGlobalConfiguration::sharedInstance().excludedFromAppUserData();
  return std::ranges::find(excluded, name) != excluded.end();
}

}  // namespace

TSYResult<TSYMetadataRef> TSYClientConnection::createOrLookupContainerWithContainerIdentity(
    const std::optional<TSYContainerIdentity>& identity, bool createIfNecessary, bool transient,
    bool useLocking) {
  return TSYCatchingExceptionsUnlessInternal(
      TSYGlobalConfiguration::sharedInstance().isInternalImage(),
      [&] { return createOrLookup(identity, createIfNecessary, transient, useLocking); });
}

TSYResult<TSYMetadataRef> TSYClientConnection::createOrLookup(
    const std::optional<TSYContainerIdentity>& identity, bool createIfNecessary, bool transient,
    bool useLocking) {
  if (!identity) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidArgument, std::nullopt, TSYLogIt::yes,
                                     "Cannot lookup a nil container identity."));
  }
  if (TSYLogIsEnabled(TSYLogLevelDebug)) {
    TSYLogWrite(TSYLogLevelDebug,
                "createOrLookup; identity: {}, createIfNecessary: {:d}, transient: {:d}, "
                "allowOtherIdLookup: {:d}, unrestricted: {:d}, clientBundleIdentifier: {}",
                *identity, createIfNecessary, transient, allowOtherIdLookup_, unrestricted_,
                clientBundleIdentifier());
  }
  if (auto allowed = checkAccess(*identity); !allowed) {
    return TSYFailure(std::move(allowed.error()));
  }

  TSYContainerCache& cache = TSYContainerCache::sharedInstance();
  if (!transient) {
    const TSYAllIdentifiersLock lock(TSYLockMode::reading, useLocking);
    auto found = cache.containerForContainerIdentity(*identity, /*transient=*/false,
                                                     /*updateSandbox=*/true);
    if (found || !found.error().is(TSYErrorNotFound)) return found;
  }
  if (!createIfNecessary) {
    return TSYFailure(TSYErrorCreate(TSYErrorNotFound, std::nullopt, TSYLogIt::no,
                                     "Container with identifier: \"{}\" Not Found",
                                     identity->identifier()));
  }

  const TSYAllIdentifiersLock lock(TSYLockMode::writing, useLocking);
  // Somebody else may have created it between the two locks.
  auto found = cache.containerForContainerIdentity(*identity, transient, /*updateSandbox=*/true);
  if (!found && !found.error().is(TSYErrorNotFound)) return found;
  if (found) {
    if (!transient) return found;
    if (auto removed = removeTransientContainer(**found); !removed) {
      return TSYFailure(std::move(removed.error()));
    }
  }
  return createContainer(*identity, transient);
}

TSYResult<void> TSYClientConnection::removeTransientContainer(const TSYMetadata& container) {
  const TSYURL url = container.url();
  const auto moved = _moveItemAtURLToDeathRow(url, /*startDeletionThread=*/true);
  if (!moved) {
    return TSYFailure(TSYErrorCreate(TSYErrorTransientRemoveFailed, moved.error(), TSYLogIt::yes,
                                     "Failed to remove transient container at {}", url.path()));
  }
  // Should the creation that follows fail, nobody must find the one that has gone.
  return TSYContainerCache::sharedInstance().removeContainerForUserIdentity(
      container.userIdentity(), container.containerClass(), container.identifier(),
      /*transient=*/true);
}

TSYResult<TSYMetadataRef> TSYClientConnection::createContainer(const TSYContainerIdentity& identity,
                                                               bool transient) {
  const std::string name = UUID::random().string();
  TSY_SIGNPOST_EVENT3(CreatingContainer, name.c_str(), identity.identifier().c_str(),
                      identity.containerClass());
  const std::optional<TSYURL> directory =
      TSYGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(
          identity.userIdentity(), identity.containerClass());
  if (!directory) {
    return TSYFailure(TSYErrorCreate(TSYErrorStagingCreateFailed, std::nullopt, TSYLogIt::yes,
                                     "Failed to create staging dir at {} : {}", "(null)",
                                     "the user has no home directory"));
  }
  Staging staging(directory->appending(name));
  const auto created = _createTopLevelContainerDirectory(
      staging.url(), identity.containerClass(),
      identity.userIdentity()->posixUIDForContainerClass(identity.containerClass()));
  if (!created) {
    return TSYFailure(TSYErrorCreate(TSYErrorStagingCreateFailed, created.error(), TSYLogIt::yes,
                                     "Failed to create staging dir at {} : {}",
                                     staging.url().path(), created.error()));
  }
  auto built = buildInStaging(identity, staging.url());
  if (!built) return TSYFailure(staging.abandon(std::move(built.error())));
  auto liveURL = moveIntoPlace(identity, transient, staging.url());
  if (!liveURL) return TSYFailure(staging.abandon(std::move(liveURL.error())));
  staging.commit();
  return enterIntoCache(std::move(*built), *liveURL, transient);
}

TSYResult<TSYMetadata> TSYClientConnection::buildInStaging(const TSYContainerIdentity& identity,
                                                           const TSYURL& stagingURL) {
  // The container's UUID has nothing to do with its directory's name.
  auto concrete = TSYConcreteContainerIdentity::containerIdentityWithUUID(
      UUID::random(), ownerOf(identity), identity.identifier(), identity.containerClass());
  if (!concrete) return TSYFailure(std::move(concrete.error()));
  TSYMetadata metadata(*concrete, /*info=*/nullptr, stagingURL, std::nullopt);
  if (auto filled = fillStaging(metadata, stagingURL); !filled) {
    return TSYFailure(std::move(filled.error()));
  }
  return metadata;
}

TSYResult<void> TSYClientConnection::fillStaging(const TSYMetadata& metadata,
                                                 const TSYURL& stagingURL) {
  if (auto written = metadata.writeMetadataToDisk(); !written) return written;
  if (TSYIsSystemClass(metadata.containerClass())) {
    auto set = TSYFileManager::defaultManager().setTopLevelSystemContainerACLAtURL(stagingURL);
    if (!set) return set;
  }
  return _createSubDirectories(stagingURL, metadata);
}

TSYResult<TSYURL> TSYClientConnection::moveIntoPlace(const TSYContainerIdentity& identity,
                                                     bool transient, const TSYURL& stagingURL) {
  const std::string name =
      TSYWhitelist::sharedWhitelist()
          .wellknownContainerForId(identity.identifier(), identity.containerClass())
          .value_or(std::string(stagingURL.lastPathComponent()));
  const std::optional<TSYURL> directory =
      TSYGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
          identity.userIdentity(), identity.containerClass(), transient);
  if (!directory) {
    return TSYFailure(TSYErrorCreate(TSYErrorStagingMoveFailed, std::nullopt, TSYLogIt::yes,
                                     "Failed to move staging dir: {} to live dir: {}",
                                     stagingURL.path(), "(null)"));
  }
  TSYURL liveURL = directory->appending(name);
  const auto moved = TSYFileManager::defaultManager().moveItemAtURL(stagingURL, liveURL);
  if (!moved) {
    return TSYFailure(TSYErrorCreate(TSYErrorStagingMoveFailed, moved.error(), TSYLogIt::yes,
                                     "Failed to move staging dir: {} to live dir: {}",
                                     stagingURL.path(), liveURL.path()));
  }
  return liveURL;
}

TSYResult<TSYMetadataRef> TSYClientConnection::enterIntoCache(TSYMetadata metadata,
                                                              const TSYURL& liveURL,
                                                              bool transient) {
  if (Platform::current().device.featureEnabled("tessaryd", "fast_container_sizing")) {
    // Makes the file system keep statistics of the directory; the size itself is of no interest.
    (void)TSYFileManager::defaultManager().fastDiskUsageForURL(liveURL);
  }
  metadata.setURL(liveURL);
  metadata.setExisted(/*existed=*/false);
  metadata.setTransient(transient);
  const auto added = TSYContainerCache::sharedInstance().addContainerMetadata(
      metadata, liveURL, transient, /*updateSandbox=*/true);
  if (!added) {
    return TSYFailure(TSYErrorCreate(TSYErrorCacheAddFailed, added.error(), TSYLogIt::yes,
                                     "Failed to add to cache : {}, url: {}, transient: {:d}",
                                     metadata.description(), liveURL.path(), transient));
  }
  return std::make_shared<const TSYMetadata>(std::move(metadata));
}

TSYResult<void> TSYClientConnection::_createTopLevelContainerDirectory(
    const TSYURL& url, TSYContainerClass containerClass, uid_t owner) {
  uid_t directoryOwner = owner;
  if (TSYIsBundleClass(containerClass)) directoryOwner = platform::kInstallationAccount;
  if (TSYIsSystemClass(containerClass)) directoryOwner = TSYFileManager::kUnchangedOwner;
  return TSYFileManager::defaultManager().createDirectoryAtURL(
      url, /*withIntermediateDirectories=*/true, kDirectoryMode, directoryOwner,
      kProtectionClassUnprotected);
}

TSYResult<void> TSYClientConnection::_createSubDirectories(const TSYURL& containerURL,
                                                           const TSYMetadata& containerMetadata) {
  const TSYContainerClass containerClass = containerMetadata.containerClass();
  const bool isSystem = TSYIsSystemClass(containerClass);
  const auto names = Platform::current().containerLayout.subdirectoriesOfClass(containerClass);
  if (!names) {
    return TSYFailure(TSYErrorCreate(names.error(), std::nullopt, TSYLogIt::yes,
                                     "Failed to get subdirectory names for {} : {}", containerClass,
                                     names.error()));
  }
  const int protectionClass = _dataProtectionClassForContainerMetadata(containerMetadata);
  TSYLogWrite(TSYLogLevelDebug, "Creating subdirectories for [{}:{}] at [{}]", containerClass,
              containerMetadata.identifier(), containerURL.path());
  for (const std::string& name : *names) {
    const TSYURL url = containerURL.appending(name);
    const int classOfName = TSYIsPerUserClass(containerClass) && isExcludedFromUserData(name)
                                ? kProtectionClassUnprotected
                                : protectionClass;
    const auto created = TSYFileManager::defaultManager().createDirectoryAtURL(
        url, /*withIntermediateDirectories=*/true, isSystem ? 0 : kDirectoryMode,
        ownerOfContent(containerMetadata), classOfName);
    if (!created) {
      return TSYFailure(TSYErrorCreate(TSYErrorCreateDirectoryFailed, created.error(),
                                       TSYLogIt::yes,
                                       "Failed to create sub-dir for {} at {} (protClass: {})",
                                       containerMetadata.identifier(), url.path(), classOfName));
    }
  }
  return {};
}

int TSYClientConnection::_dataProtectionClassForContainerMetadata(const TSYMetadata& metadata) {
  if (!TSYIsPerUserClass(metadata.containerClass())) return kProtectionClassUnprotected;
  if (metadata.info()) {
    const auto found = metadata.info()->find(kContentProtectionClassKey);
    if (found != metadata.info()->end() && found->second.isNumber()) {
      return static_cast<int>(found->second.unsignedOfNumber().value_or(0));
    }
  }
  return TSYDataProtectionManager::defaultManager()
      .intendedDataProtectionClassBasedOnEntitlementsForIdentifier(metadata.identifier());
}
