#include "Daemon/TSYDataProtectionManager.h"

TSYDataProtectionManager& TSYDataProtectionManager::defaultManager() {
  static TSYDataProtectionManager instance;
  return instance;
}

int TSYDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& /*identifier*/) {
  constexpr int kNoClass = 0;
  return kNoClass;
}
