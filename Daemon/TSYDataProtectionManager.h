// The protection classes of data containers.
//
// Changing a class is not built yet.
//
// All operations may be called from any thread.
#pragma once

#include <string>

class TSYDataProtectionManager {
 public:
  static TSYDataProtectionManager& defaultManager();

  // The protection class that the entitlements of an application ask for; 0 when they ask for
  // nothing, or for an unknown one (logged).
  int intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string& identifier);
};
