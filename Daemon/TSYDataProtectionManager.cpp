#include "Daemon/TSYDataProtectionManager.h"

#include <algorithm>
#include <array>
#include <string_view>

#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYPropertyList.h"

namespace {

constexpr int kNoClass = 0;

// The first of these entitlements that is a string counts.
constexpr std::array kEntitlements = {"com.veltra.developer.default-data-protection",
                                      "data-protection-class", "DataProtectionClass"};

struct ClassName {
  std::string_view name;
  int protectionClass;
};
constexpr std::array kClassNames = {
    ClassName{"complete", 1},
    ClassName{"complete-unless-open", 2},
    ClassName{"complete-until-first-user-authentication", 3},
    ClassName{"none", 4},
    ClassName{"write-only", 2},
    ClassName{"complete-until-user-authentication", 3},
};

const std::string* nameIn(const platform::Value::Dictionary& entitlements) {
  for (const char* key : kEntitlements) {
    const platform::Value* value = TSYValueUnder(entitlements, key);
    if (value != nullptr && value->asString() != nullptr) return value->asString();
  }
  return nullptr;
}

}  // namespace

TSYDataProtectionManager& TSYDataProtectionManager::defaultManager() {
  static TSYDataProtectionManager instance;
  return instance;
}

int TSYDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
  const auto entitlements =
      TSYCodeSigningMapping::sharedInstance().entitlementsForIdentifier(identifier);
  const std::string* name = entitlements ? nameIn(*entitlements) : nullptr;
  if (name == nullptr) return kNoClass;
  const auto* const known = std::ranges::find(kClassNames, *name, &ClassName::name);
  if (known != kClassNames.end()) return known->protectionClass;
  TSYLogWrite(TSYLogLevelError,
              "Unknown value for DataProtectionClass entitlement: {}; defaulting to class {}",
              *name, kNoClass);
  return kNoClass;
}
