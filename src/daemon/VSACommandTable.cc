#include "daemon/VSACommandTable.h"

#include "daemon/VSAEntitlements.h"

namespace {
constexpr bool R = true, O = true, L = true, _ = false;
const char* const allowed = kVSAEntitlementAllowed;
const char* const uma = kVSAEntitlementUserManagedAssets;
const char* const testability = kVSAEntitlementTestability;

using namespace VSACommands;

// Indexed by command number. Handlers arrive with the operations they call; a
// null handler answers 49.
const std::array<VSACommandTableEntry, kVSACommandCount> kTable = {{
    {kCreateOrLookup, VSAHandleCreateOrLookup, allowed, R, O, L},
    {kListContainers, VSAHandleListContainers, allowed, R, _, L},
    {kReplaceContainer, VSAHandleReplaceContainer, allowed, R, _, _},
    {kStageForDelete, VSAHandleStageForDelete, allowed, R, _, _},
    {kDeleteDeathRow, VSAHandleDeleteDeathRow, uma, _, _, _},
    {kSetInfoValue, VSAHandleSetInfoValue, allowed, R, _, _},
    {kInfoValue, VSAHandleInfoValue, allowed, R, _, _},
    {kContainerMetadata, VSAHandleContainerMetadata, allowed, R, _, _},
    {kRecreateDefaultStructure, VSAHandleRecreateDefaultStructure, allowed, R, _, _},
    {kRegenerateDirectoryUUID, VSAHandleRegenerateDirectoryUUID, allowed, R, _, _},
    {kDeleteContainer, VSAHandleDeleteContainer, allowed, R, _, _},
    {kWipePluginData, VSAHandleWipePluginData, kVSAEntitlementWipeContainer, R, _, _},
    {kDeleteContainerContent, VSAHandleDeleteContainerContent,
     kVSAEntitlementDeleteContainerContent, R, _, _},
    {kGroupContainers, VSAHandleGroupContainers, allowed, R, O, L},
    {kGroupContainerIdentifiers, VSAHandleGroupContainerIdentifiers, allowed, R, _, L},
    {kSystemContainerPath, VSAHandleSystemContainerPath, allowed, R, O, L},
    {kGroupContainerPaths, VSAHandleGroupContainerPaths, allowed, R, O, L},
    {kSystemGroupContainerPath, VSAHandleSystemGroupContainerPath, allowed, R, O, L},
    {kRecordCodeSigningInfo, VSAHandleRecordCodeSigningInfo, allowed, R, _, _},
    {kReadCodeSigningInfo, VSAHandleReadCodeSigningInfo, allowed, R, _, _},
    {kInvalidateAppsWithoutBundle, VSAHandleInvalidateAppsWithoutBundle, allowed, R, _, _},
    {kSetDataProtection, VSAHandleSetDataProtection, allowed, _, _, _},
    {kRestoreDefaultStructure, VSAHandleRecreateDefaultStructure, allowed, R, _, _},
    {kDiskUsage, VSAHandleDiskUsage, allowed, R, _, L},
    {kDataMigration, VSAHandleDataMigration, kVSAEntitlementDataMigration, R, _, _},
    {kRetryTest, VSAHandleRetryTest, testability, R, _, _},
    {kStageSharedContent, VSAHandleStageSharedContent, kVSAEntitlementStageSharedContent, R, _, _},
    {kRetired, VSAHandleRetiredCommand, allowed, R, _, _},
    {kUserManagedAssetsPath, VSAHandleUserManagedAssetsPath, uma, R, O, _},
    {kDeleteUserManagedAsset, VSAHandleDeleteUserManagedAsset, uma, R, _, _},
    {kPerUserDataMigration, VSAHandlePerUserDataMigration, allowed, R, _, _},
    {kTestLock, VSAHandleTestLock, testability, R, _, _},
    {kPersonaUniqueStrings, VSAHandlePersonaUniqueStrings, allowed, R, O, L},
}};
}  // namespace

const std::array<VSACommandTableEntry, kVSACommandCount>& VSACommandTable() { return kTable; }
