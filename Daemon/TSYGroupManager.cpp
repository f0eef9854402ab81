#include "Daemon/TSYGroupManager.h"

#include "Daemon/TSYCommandStageForDelete.h"
#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"

TSYGroupManager& TSYGroupManager::defaultManager() {
  static TSYGroupManager manager(TSYUserIdentitySharedCache::sharedInstance());
  return manager;
}

TSYGroupManager::TSYGroupManager(TSYUserIdentityCache& userIdentityCache)
    : userIdentityCache_(userIdentityCache) {}

void TSYGroupManager::reconcileGroupContainersOfType(TSYGroupType type,
                                                     TSYCommandQueue& commandQueue) {
  const auto counts = TSYCodeSigningMapping::sharedInstance().copyReferenceCountSetOfType(type);
  if (!counts) {
    TSYLogWrite(TSYLogLevelError, "Failed to get reference count information for group type: {}",
                static_cast<int64_t>(type));
    return;
  }
  if (type == TSYGroupType::system) {
    _cleanupUnreferencedGroupContainersForUserIdentity(TSYUserIdentityCache::defaultUserIdentity(),
                                                       kTSYContainerClassSystemGroup, *counts,
                                                       commandQueue);
    return;
  }
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const TSYUserIdentityRef& user) {
        if (!configuration.getPerUserConfigurationForUserIdentity(user).existsUserBaseDirectory()) {
          return;
        }
        _cleanupUnreferencedGroupContainersForUserIdentity(user, kTSYContainerClassAppGroup,
                                                           *counts, commandQueue);
      });
}

void TSYGroupManager::_cleanupUnreferencedGroupContainersForUserIdentity(
    const TSYUserIdentityRef& userIdentity, TSYContainerClass containerClass,
    const TSYCodeSigningMapping::ReferenceCounts& referenceCounts, TSYCommandQueue& commandQueue) {
  const std::string user = userIdentity ? userIdentity->shortDescription() : "(null)";
  const auto containers = TSYContainerCache::sharedInstance().allContainersForUserIdentity(
      userIdentity, containerClass, /*transient=*/false);
  if (!containers) {
    TSYLogWrite(TSYLogLevelError, "Failed to fetch group container list for {}: {}", user,
                containers.error());
    return;
  }
  for (const TSYMetadataRef& container : *containers) {
    const std::string& group = container->identifier();
    if (referenceCounts.contains(group)) continue;
    TSYLogWrite(TSYLogLevelError, "Removing group container {} for {} at {}", group, user,
                container->url().path());
    commandQueue.insertCommand(
        TSYCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            {std::make_shared<const TSYConcreteContainerIdentity>(container->containerIdentity())},
            /*useLocking=*/false, [group, user](uint64_t code) {
              TSYLogWrite(TSYLogLevelError,
                          "Failed to destroy group container with identifier {} for {}: {}", group,
                          user, code);
            }));
  }
}

TSYResult<std::vector<std::string>> TSYGroupManager::groupContainerIdentifiersForOwnerIdentifier(
    const std::string& ownerIdentifier, TSYContainerClass groupContainerClass, bool useLocking) {
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, useLocking);
  const bool isInternalImage = TSYGlobalConfiguration::sharedInstance().isInternalImage();
  return TSYCatchingExceptionsUnlessInternal(
      isInternalImage, [&]() -> TSYResult<std::vector<std::string>> {
        TSYCodeSigningMapping& mapping = TSYCodeSigningMapping::sharedInstance();
        auto groups = groupContainerClass == kTSYContainerClassSystemGroup
                          ? mapping.systemGroupIdentifiersForIdentifier(ownerIdentifier)
                          : mapping.appGroupIdentifiersForIdentifier(ownerIdentifier);
        return std::move(groups).value_or(std::vector<std::string>());
      });
}
