// Which groups an application or a service may use, and the sweep over the groups on disk.
//
// A group container exists as long as some code-signing entry names the group. The mapping removes
// it when the last one stops naming it; the sweep finds what was missed.
//
// All operations may be called from any thread.
#pragma once

#include <string>
#include <vector>

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYContainerClass.h"
#include "Daemon/TSYError.h"

class TSYGroupManager {
 public:
  static TSYGroupManager& defaultManager();
  explicit TSYGroupManager(TSYUserIdentityCache& userIdentityCache);

  // Puts the deletion of every group container that no entry names on `commandQueue`, for each user
  // who has it. The commands take no lock: their queue is run while nobody else can look up or
  // create a container, under the global write lock of whoever asks for the sweep. Failures are
  // logged.
  void reconcileGroupContainersOfType(TSYGroupType type, TSYCommandQueue& commandQueue);

  // The identifiers of the groups that an owner is entitled to: system groups for class 13, else
  // application groups. With useLocking false the caller holds the identifier locks. Code 40.
  TSYResult<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
      const std::string& ownerIdentifier, TSYContainerClass groupContainerClass, bool useLocking);

 private:
  static void _cleanupUnreferencedGroupContainersForUserIdentity(
      const TSYUserIdentityRef& userIdentity, TSYContainerClass containerClass,
      const TSYCodeSigningMapping::ReferenceCounts& referenceCounts, TSYCommandQueue& commandQueue);

  TSYUserIdentityCache& userIdentityCache_;
};
