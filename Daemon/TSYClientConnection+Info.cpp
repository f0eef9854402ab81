// Reading and changing one existing container: its info values, its structure, its directory's name
// and its size; and the groups of an owner.
//
// What is found before its lock is taken is found again under the lock before it is changed.
#include "Daemon/TSYCacheSteps.h"
#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGroupManager.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYWhitelist.h"
#include "Platform/os/Platform.h"

using platform::UUID;
using platform::Value;

namespace {

// The size of a bundle, in bytes, once it has been measured.
constexpr char kStaticDiskUsageKey[] = "com.veltra.Hatchery.StaticDiskUsage";
// Other services hold its path for good.
constexpr char kAnalyticsGroup[] = "systemgroup.com.veltra.analytics";

TSYMetadata::Info withValue(const TSYMetadata::Info& info, const std::string& key,
                            const std::optional<Value>& value) {
  Value::Dictionary changed = info ? *info : Value::Dictionary();
  if (value) {
    changed.insert_or_assign(key, *value);
  } else {
    changed.erase(key);
  }
  return std::make_shared<const Value::Dictionary>(std::move(changed));
}

// The one ordinary system group whose directory keeps its name, and those whose name is fixed.
bool keepsItsDirectoryName(const TSYMetadata& container) {
  const bool isAnalytics = container.containerClass() == kTSYContainerClassSystemGroup &&
                           container.identifier() == kAnalyticsGroup;
  return isAnalytics || TSYWhitelist::sharedWhitelist().containerIdIsWellknown(
                            container.identifier(), container.containerClass());
}

}  // namespace

TSYResult<void> TSYClientConnection::setInfoValue(const std::optional<Value>& value,
                                                  const std::optional<std::string>& key,
                                                  const TSYConcreteContainerIdentity& identity,
                                                  bool useLocking) {
  if (!key) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidArgument, std::nullopt, TSYLogIt::yes,
                                     "Can't set a value for a nil or non-string key: {}",
                                     "(null)"));
  }
  const TSYIdentifierLock lock(TSYLockMode::writing, identity.uuid().string(), useLocking);
  const auto container = TSYFindContainer(identity);
  if (!container) return TSYFailure(container.error());
  TSYMetadata changed = **container;
  changed.setInfo(withValue(changed.info(), *key, value));
  if (auto written = changed.writeMetadataToDisk(); !written) return written;
  return TSYAddToCache(changed, changed.url(), changed.transient(), /*updateSandbox=*/false);
}

TSYResult<Value> TSYClientConnection::infoValueForKey(const std::optional<std::string>& key,
                                                      const TSYConcreteContainerIdentity& identity,
                                                      bool useLocking) {
  if (!key) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidArgument, std::nullopt, TSYLogIt::yes,
                                     "Can't get the value of a nil or non-string key: {}",
                                     "(null)"));
  }
  const TSYIdentifierLock lock(TSYLockMode::reading, identity.uuid().string(), useLocking);
  const auto container = TSYFindContainer(identity);
  if (!container) return TSYFailure(container.error());
  if (const TSYMetadata::Info& info = (*container)->info()) {
    if (const auto found = info->find(*key); found != info->end()) return found->second;
  }
  return TSYFailure(TSYErrorCreate(TSYErrorInfoValueNotFound, std::nullopt, TSYLogIt::no,
                                   "Didn't find info value for key: {}", *key));
}

TSYResult<TSYMetadataRef> TSYClientConnection::metadataWithContainerIdentity(
    const TSYConcreteContainerIdentity& identity) {
  const TSYIdentifierLock lock(TSYLockMode::reading, identity.uuid().string(),
                               /*useLocking=*/true);
  TSYMetadataRef container =
      TSYContainerCache::sharedInstance().containerForContainerIdentity(identity);
  if (container) return container;
  return TSYFailure(TSYErrorCreate(TSYErrorNotFound, std::nullopt, TSYLogIt::yes,
                                   "No Container with user identity: {}", identity.description()));
}

TSYResult<void> TSYClientConnection::recreateDefaultStructureWithContainerIdentity(
    const TSYConcreteContainerIdentity& identity) {
  const TSYIdentifierLock lock(TSYLockMode::writing, identity.uuid().string(),
                               /*useLocking=*/true);
  const auto container = TSYFindContainer(identity);
  if (!container) return TSYFailure(container.error());
  const TSYURL url = (*container)->url();
  auto created = _createSubDirectories(url, **container);
  if (!created || !TSYIsSystemClass((*container)->containerClass())) return created;
  return TSYFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(url);
}

TSYResult<void> TSYClientConnection::regenerateDirectoryUUIDWithContainerIdentity(
    const TSYConcreteContainerIdentity& identity) {
  return TSYCatchingExceptions([&] { return regenerateDirectoryUUID(identity); });
}

TSYResult<void> TSYClientConnection::regenerateDirectoryUUID(
    const TSYConcreteContainerIdentity& identity) {
  if (auto found = TSYFindContainer(identity); !found) return TSYFailure(std::move(found.error()));
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  const auto container = TSYFindContainer(identity);
  if (!container) return TSYFailure(container.error());
  const TSYURL url = (*container)->url();
  const std::string name(url.lastPathComponent());
  if (!UUID::parse(name)) {
    return TSYFailure(TSYErrorCreate(TSYErrorInvalidObject, std::nullopt, TSYLogIt::yes,
                                     "Non-UUID last path component: {} for {}", name,
                                     identity.description()));
  }
  const TSYURL newURL = url.deletingLastPathComponent().appending(UUID::random().string());
  const auto moved = TSYFileManager::defaultManager().moveItemAtURL(url, newURL);
  if (!moved) {
    return TSYFailure(TSYErrorCreate(TSYErrorUUIDMoveFailed, moved.error(), TSYLogIt::yes,
                                     "Failed to move dir: {} to new UUID dir: {}", url.path(),
                                     newURL.path()));
  }
  auto added =
      TSYAddToCache(**container, newURL, (*container)->transient(), /*updateSandbox=*/true);
  // What the cache does not know must not be there under another name than it knows.
  if (!added) (void)TSYFileManager::defaultManager().renameItemAtURL(newURL, url);
  return added;
}

void TSYClientConnection::_regenerateAllSystemContainerPaths() {
  TSYLogWrite(TSYLogLevelNotice, "Rolling system container directory UUIDs on disk");
  for (const TSYContainerClass containerClass :
       {kTSYContainerClassSystemData, kTSYContainerClassSystemGroup}) {
    const auto containers = TSYContainerCache::sharedInstance().allContainersForUserIdentity(
        clientIdentity_->userIdentity(), containerClass, /*transient=*/false,
        /*populateSandboxCache=*/false);
    if (!containers) {
      TSYLogWrite(TSYLogLevelError, "Failed to get list of system containers for migration: {}",
                  containers.error());
      continue;
    }
    for (const TSYMetadataRef& container : *containers) {
      if (keepsItsDirectoryName(*container)) continue;
      if (regenerateDirectoryUUIDWithContainerIdentity(container->containerIdentity())) continue;
      TSYLogWrite(TSYLogLevelError,
                  "Failed to regenerate directory UUID for identifier: {}, class: {}",
                  container->identifier(), containerClass);
    }
  }
}

TSYResult<uint64_t> TSYClientConnection::diskUsageWithContainerIdentity(
    const TSYConcreteContainerIdentity& identity) {
  return TSYCatchingExceptions([&] { return diskUsage(identity); });
}

TSYResult<uint64_t> TSYClientConnection::diskUsage(const TSYConcreteContainerIdentity& identity) {
  static const bool isFast =
      platform::Platform::current().device.featureEnabled("tessaryd", "fast_container_sizing");
  TSYMetadataRef container;
  {
    const TSYIdentifierLock lock(TSYLockMode::reading, identity.uuid().string(),
                                 /*useLocking=*/true);
    auto found = TSYFindContainer(identity);
    if (!found) return TSYFailure(std::move(found.error()));
    container = std::move(*found);
    if (TSYIsBundleClass(container->containerClass())) {
      const auto known = infoValueForKey(kStaticDiskUsageKey, identity, /*useLocking=*/false);
      if (known && known->asUInt64()) return *known->asUInt64();
      if (!known && !known.error().is(TSYErrorInfoValueNotFound)) {
        TSYLogWrite(TSYLogLevelError, "Error looking up info value for identity: {}: {}",
                    identity.description(), known.error().code());
      }
    }
  }
  const uint64_t size = TSYFileManager::defaultManager().fastDiskUsageForURL(container->url());
  if (!isFast && TSYIsBundleClass(container->containerClass())) {
    const auto set = setInfoValue(Value(size), kStaticDiskUsageKey, identity, /*useLocking=*/true);
    if (!set) {
      TSYLogWrite(TSYLogLevelError, "Error setting info value for identity: {}: {}",
                  identity.description(), set.error().code());
    }
  }
  return size;
}

TSYResult<void> TSYClientConnection::checkGroupAccess(const std::string& ownerIdentifier,
                                                      TSYContainerClass groupContainerClass) {
  if (mayLookUpOf(groupContainerClass, ownerIdentifier)) return {};
  return TSYFailure(TSYErrorCreate(TSYErrorNotEntitled, std::nullopt, TSYLogIt::yes,
                                   "{} not entitled to retrieve group container class {} with "
                                   "identifier {}",
                                   clientBundleIdentifier(), groupContainerClass, ownerIdentifier));
}

TSYResult<TSYClientConnection::GroupContainers>
TSYClientConnection::groupContainersForOwnerIdentifier(const std::string& ownerIdentifier,
                                                       const TSYUserIdentityRef& userIdentity,
                                                       TSYContainerClass groupContainerClass) {
  if (auto allowed = checkGroupAccess(ownerIdentifier, groupContainerClass); !allowed) {
    return TSYFailure(std::move(allowed.error()));
  }
  allowGroupIdLookup_ = true;
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  const auto groups = TSYGroupManager::defaultManager().groupContainerIdentifiersForOwnerIdentifier(
      ownerIdentifier, groupContainerClass, /*useLocking=*/false);
  if (!groups) return TSYFailure(groups.error());
  GroupContainers containers;
  for (const std::string& group : *groups) {
    auto identity = TSYContainerIdentity::containerIdentityWithUserIdentity(userIdentity, group,
                                                                            groupContainerClass);
    auto found = identity ? createOrLookupContainerWithContainerIdentity(
                                std::move(*identity), /*createIfNecessary=*/true,
                                /*transient=*/false, /*useLocking=*/false)
                          : TSYResult<TSYMetadataRef>(TSYFailure(identity.error()));
    if (found) {
      containers.emplace(group, std::move(*found));
    } else {
      TSYLogWrite(TSYLogLevelError, "Failed to create or lookup group container: {} : {}", group,
                  found.error().code());
    }
  }
  return containers;
}
