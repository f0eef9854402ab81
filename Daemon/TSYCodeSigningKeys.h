// The keys of code-signing information, of the entitlements in it that name containers, and of the
// options that it is registered with.
#pragma once

// The one key of the information that the daemon reads: the entitlements dictionary.
inline constexpr char kTSYCodeSigningEntitlements[] = "com.veltra.Tessary.Entitlements";

// Entitlements. Each list of groups is an array of strings, or one string.
inline constexpr char kTSYEntitlementApplicationGroups[] = "com.veltra.security.application-groups";
inline constexpr char kTSYEntitlementSystemGroups[] = "com.veltra.security.system-groups";
// In place of the key above when that names none.
inline constexpr char kTSYEntitlementSystemGroupContainers[] =
    "com.veltra.security.system-group-containers";
inline constexpr char kTSYEntitlementSystemContainer[] = "com.veltra.security.system-container";

// Options of a registration.
inline constexpr char kTSYOptionDataContainerClass[] = "com.veltra.Tessary.DataContainerClass";
inline constexpr char kTSYOptionParentBundleID[] = "com.veltra.Tessary.ParentBundleID";
inline constexpr char kTSYOptionRegisteredByCaller[] = "RegByCaller";
inline constexpr char kTSYOptionPlaceholder[] = "com.veltra.Tessary.PlaceholderEntitlements";
inline constexpr char kTSYOptionAdvanceCopy[] = "com.veltra.Tessary.AdvanceCopy";
