// The container classes: what kind of container a number stands for and where it lives.
#pragma once

#include <cstdint>
#include <string_view>

using TSYContainerClass = uint64_t;

inline constexpr TSYContainerClass kTSYContainerClassAppBundle = 1;
inline constexpr TSYContainerClass kTSYContainerClassAppData = 2;
inline constexpr TSYContainerClass kTSYContainerClassPluginBundle = 3;
inline constexpr TSYContainerClass kTSYContainerClassPluginData = 4;
inline constexpr TSYContainerClass kTSYContainerClassVPNPluginBundle = 5;
inline constexpr TSYContainerClass kTSYContainerClassVPNPluginData = 6;
inline constexpr TSYContainerClass kTSYContainerClassAppGroup = 7;
inline constexpr TSYContainerClass kTSYContainerClassInternalDaemon = 10;
inline constexpr TSYContainerClass kTSYContainerClassSystemData = 12;
inline constexpr TSYContainerClass kTSYContainerClassSystemGroup = 13;
// Not a class: the end marker.
inline constexpr TSYContainerClass kTSYContainerClassMax = 14;

// 1 to 13.
bool TSYIsContainerClass(uint64_t number);
// 1, 3, 5, 8: installed code, in the global tree.
bool TSYIsBundleClass(uint64_t number);
// 12 and 13: containers of system services, in the global tree.
bool TSYIsSystemClass(uint64_t number);
// Bundle and system classes: their containers do not depend on a user.
bool TSYIsGlobalClass(uint64_t number);
// 2, 4, 6, 7, 9, 10, 11: under the home of a user identity.
bool TSYIsPerUserClass(uint64_t number);

// The class directory, relative to its tree, such as "Data/Application"; "Undefined" for 0, "MAX"
// for 14 and above.
std::string_view TSYContainerClassDirectory(uint64_t number);
// The short name, such as "appData"; empty for what is no class.
std::string_view TSYContainerClassKey(uint64_t number);
