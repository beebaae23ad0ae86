#include "daemon/VSACommandTable.h"

#include "daemon/VSAEntitlements.h"

namespace {
constexpr bool R = true, O = true, L = true, _ = false;
const char* const allowed = kVSAEntitlementAllowed;
const char* const uma = kVSAEntitlementUserManagedAssets;
const char* const testability = kVSAEntitlementTestability;

// Handlers arrive with the operations they call; a null handler answers 49.
const std::array<VSACommandTableEntry, kVSACommandCount> kTable = {{
    {0, VSAHandleCreateOrLookup, allowed, R, O, L},    // create or look up a container
    {1, VSAHandleListContainers, allowed, R, _, L},    // list containers of a class
    {2, VSAHandleReplaceContainer, allowed, R, _, _},  // replace a container by another
    {3, VSAHandleStageForDelete, allowed, R, _, _},    // stage containers for deletion
    {4, VSAHandleDeleteDeathRow, uma, _, _, _},    // empty death row (replies from its completion)
    {5, VSAHandleSetInfoValue, allowed, R, _, _},  // set a metadata info value
    {6, VSAHandleInfoValue, allowed, R, _, _},     // read a metadata info value
    {7, VSAHandleContainerMetadata, allowed, R, _, _},  // read a container's metadata
    {8, VSAHandleRecreateDefaultStructure, allowed, R, _,
     _},  // recreate a container's default structure
    {9, VSAHandleRegenerateDirectoryUUID, allowed, R, _,
     _},                                               // regenerate a container's directory UUID
    {10, VSAHandleDeleteContainer, allowed, R, _, _},  // delete a container
    {11, VSAHandleWipePluginData, kVSAEntitlementWipeContainer, R, _, _},  // wipe data of class 4
    {12, VSAHandleDeleteContainerContent, kVSAEntitlementDeleteContainerContent, R, _,
     _},                                               // delete data content
    {13, VSAHandleGroupContainers, allowed, R, O, L},  // group containers with tokens and personas
    {14, VSAHandleGroupContainerIdentifiers, allowed, R, _,
     L},  // group container identifiers of an owner
    {15, VSAHandleSystemContainerPath, allowed, R, O, L},       // path of a system container
    {16, VSAHandleGroupContainerPaths, allowed, R, O, L},       // group container paths of an owner
    {17, VSAHandleSystemGroupContainerPath, allowed, R, O, L},  // path of a system group container
    {18, VSAHandleRecordCodeSigningInfo, allowed, R, _, _},     // record code-signing information
    {19, VSAHandleReadCodeSigningInfo, allowed, R, _, _},       // read code-signing information
    {20, VSAHandleInvalidateAppsWithoutBundle, allowed, R, _, _},  // invalidate apps without bundle
    {21, VSAHandleSetDataProtection, allowed, _, _,
     _},  // change data protection (replies from its completion)
    {22, VSAHandleRecreateDefaultStructure, allowed, R, _,
     _},                                         // recreate a container's default structure
    {23, VSAHandleDiskUsage, allowed, R, _, L},  // disk usage of a container
    {24, VSAHandleDataMigration, kVSAEntitlementDataMigration, R, _, _},  // data migration
    {25, VSAHandleRetryTest, testability, R, _, _},                       // crash-retry test
    {26, VSAHandleStageSharedContent, kVSAEntitlementStageSharedContent, R, _,
     _},                                                  // stage shared content
    {27, VSAHandleRetiredCommand, allowed, R, _, _},      // retired
    {28, VSAHandleUserManagedAssetsPath, uma, R, O, _},   // path of a user-managed assets directory
    {29, VSAHandleDeleteUserManagedAsset, uma, R, _, _},  // delete a user-managed asset
    {30, VSAHandlePerUserDataMigration, allowed, R, _, _},  // per-user data migration
    {31, VSAHandleTestLock, testability, R, _, _},          // set or clear a test lock
    {32, VSAHandlePersonaUniqueStrings, allowed, R, O, L},  // persona unique strings
}};
}  // namespace

const std::array<VSACommandTableEntry, kVSACommandCount>& VSACommandTable() { return kTable; }
