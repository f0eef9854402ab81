#include "Daemon/TSYGroupManager.h"

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLocks.h"

TSYGroupManager& TSYGroupManager::defaultManager() {
  static TSYGroupManager manager;
  return manager;
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
