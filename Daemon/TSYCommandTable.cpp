#include "Daemon/TSYCommandTable.h"

#include "Daemon/TSYCommandHandlers.h"
#include "Daemon/TSYEntitlements.h"

namespace {

// The three flags of a row, in the order of its fields.
struct Flags {
  bool repliesOnReturn;
  bool allowUnentitled;
  bool consultsLookup;
};

constexpr Flags kPlain{true, false, false};
constexpr Flags kDeferred{false, false, false};
constexpr Flags kLookup{true, false, true};
constexpr Flags kUnentitled{true, true, false};
constexpr Flags kUnentitledLookup{true, true, true};

constexpr TSYCommandRow row(uint64_t command, TSYCommandHandler handler, const char* entitlement,
                            Flags flags) {
  return {command,
          handler,
          entitlement,
          flags.repliesOnReturn,
          flags.allowUnentitled,
          flags.consultsLookup};
}

// The operation behind the row is not built yet.
constexpr TSYCommandHandler kNotBuilt = TSYHandleNotBuilt;
constexpr const char* kAllowed = kTSYEntitlementAllowed;

constexpr std::array<TSYCommandRow, kTSYCommandCount> kTable = {{
    row(0, TSYHandleCreateOrLookup, kAllowed, kUnentitledLookup),
    row(1, TSYHandleContainersOfClass, kAllowed, kLookup),
    row(2, TSYHandleReplaceContainer, kAllowed, kPlain),
    row(3, TSYHandleStageForDelete, kAllowed, kPlain),
    row(4, TSYHandleEmptyDeathRow, kTSYEntitlementUserManagedAssets, kDeferred),
    row(5, TSYHandleSetInfoValue, kAllowed, kPlain),
    row(6, TSYHandleGetInfoValue, kAllowed, kPlain),
    row(7, TSYHandleGetMetadata, kAllowed, kPlain),
    row(8, TSYHandleRecreateStructure, kAllowed, kPlain),
    row(9, TSYHandleRegenerateUUID, kAllowed, kPlain),
    row(10, TSYHandleDeleteContainer, kAllowed, kPlain),
    row(11, TSYHandleWipePluginData, kTSYEntitlementWipeContainer, kPlain),
    row(12, TSYHandleDeleteDataContent, kTSYEntitlementDeleteContainerContent, kPlain),
    row(13, TSYHandleGroupContainersForOwner, kAllowed, kUnentitledLookup),
    row(14, TSYHandleGroupIdentifiersForOwner, kAllowed, kLookup),
    row(15, TSYHandleSystemContainerPath, kAllowed, kUnentitledLookup),
    row(16, TSYHandleSystemGroupContainersForOwner, kAllowed, kUnentitledLookup),
    row(17, TSYHandleSystemGroupContainerPath, kAllowed, kUnentitledLookup),
    row(18, TSYHandleRegisterCodeSigningInfo, kAllowed, kPlain),
    row(19, TSYHandleGetCodeSigningInfo, kAllowed, kPlain),
    row(20, TSYHandleInvalidateCodeSigningInfo, kAllowed, kPlain),
    row(21, kNotBuilt, kAllowed, kDeferred),
    row(22, TSYHandleRecreateStructure, kAllowed, kPlain),
    row(23, TSYHandleDiskUsage, kAllowed, kLookup),
    row(24, kNotBuilt, kTSYEntitlementDataMigration, kPlain),
    row(25, kNotBuilt, kTSYEntitlementTestability, kPlain),
    row(26, TSYHandleStageSharedContent, kTSYEntitlementStageSharedContent, kPlain),
    row(27, TSYHandleRetired, kAllowed, kPlain),
    row(28, TSYHandleUserManagedAssetsPath, kTSYEntitlementUserManagedAssets, kUnentitled),
    row(29, TSYHandleDeleteUserManagedAsset, kTSYEntitlementUserManagedAssets, kPlain),
    row(30, kNotBuilt, kAllowed, kPlain),
    row(31, kNotBuilt, kTSYEntitlementTestability, kPlain),
    row(32, TSYHandlePersonaList, kAllowed, kUnentitledLookup),
}};

}  // namespace

const std::array<TSYCommandRow, kTSYCommandCount>& TSYCommandTable() {
  return kTable;
}
