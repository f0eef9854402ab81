#include "Daemon/TSYContainerClass.h"

#include <algorithm>
#include <array>

namespace {

// Bit n stands for class n.
constexpr uint64_t kBundleClasses = 0x12a;
constexpr uint64_t kPerUserClasses = 0xed4;

constexpr std::array<std::string_view, kTSYContainerClassMax + 1> kDirectories = {
    "Undefined",
    "Bundle/Application",
    "Data/Application",
    "Bundle/ModulinePlugin",
    "Data/ModulinePlugin",
    "Bundle/VPNPlugin",
    "Data/VPNPlugin",
    "Shared/AppGroup",
    "Bundle/Framework",
    "Data/RelayService",
    "Data/InternalDaemon",
    "Data/TempDir",
    "Data/System",
    "Shared/SystemGroup",
    "MAX"};

constexpr std::array<std::string_view, kTSYContainerClassMax> kKeys = {
    "",         "app",       "appData",      "plugin", "pluginData", "vpn",        "vpnData",
    "appGroup", "framework", "relayService", "daemon", "tempDir",    "systemData", "systemGroup"};

constexpr bool contains(uint64_t classes, uint64_t number) {
  return number < kTSYContainerClassMax && ((classes >> number) & 1) != 0;
}

}  // namespace

bool TSYIsContainerClass(uint64_t number) {
  return number >= 1 && number < kTSYContainerClassMax;
}

bool TSYIsBundleClass(uint64_t number) {
  return contains(kBundleClasses, number);
}

bool TSYIsSystemClass(uint64_t number) {
  return (number | 1) == kTSYContainerClassSystemGroup;
}

bool TSYIsGlobalClass(uint64_t number) {
  return TSYIsBundleClass(number) || TSYIsSystemClass(number);
}

bool TSYIsPerUserClass(uint64_t number) {
  return contains(kPerUserClasses, number);
}

std::string_view TSYContainerClassDirectory(uint64_t number) {
  return kDirectories[std::min(number, kTSYContainerClassMax)];
}

std::string_view TSYContainerClassKey(uint64_t number) {
  return TSYIsContainerClass(number) ? kKeys[number] : std::string_view();
}
