// Which groups an application or a service may use.
//
// The sweep that removes the group containers which nobody names any more is not built yet.
//
// All operations may be called from any thread.
#pragma once

#include <string>
#include <vector>

#include "Daemon/TSYContainerClass.h"
#include "Daemon/TSYError.h"

class TSYGroupManager {
 public:
  static TSYGroupManager& defaultManager();

  // The identifiers of the groups that an owner is entitled to: system groups for class 13, else
  // application groups. With useLocking false the caller holds the identifier locks. Code 40.
  TSYResult<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
      const std::string& ownerIdentifier, TSYContainerClass groupContainerClass, bool useLocking);
};
