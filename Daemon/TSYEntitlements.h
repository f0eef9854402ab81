// The entitlements that decide what a client may do.
#pragma once

inline constexpr char kTSYEntitlementAllowed[] = "com.veltra.private.Tessary.allowed";
inline constexpr char kTSYEntitlementOtherIdLookup[] = "com.veltra.private.Tessary.otherIdLookup";
inline constexpr char kTSYEntitlementLookup[] = "com.veltra.private.Tessary.lookup";
inline constexpr char kTSYEntitlementUserManagedAssets[] =
    "com.veltra.private.Tessary.userManagedAssets";
inline constexpr char kTSYEntitlementWipeContainer[] = "com.veltra.private.Tessary.wipeContainer";
inline constexpr char kTSYEntitlementDeleteContainerContent[] =
    "com.veltra.private.Tessary.deleteContainerContent";
inline constexpr char kTSYEntitlementDataMigration[] = "com.veltra.private.Tessary.dataMigration";
inline constexpr char kTSYEntitlementTestability[] = "com.veltra.private.Tessary.testability";
inline constexpr char kTSYEntitlementStageSharedContent[] =
    "com.veltra.private.Tessary.stageSharedContent";
