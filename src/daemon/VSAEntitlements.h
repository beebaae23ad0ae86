// Entitlement names read from clients.
#pragma once

inline constexpr const char* kVSAEntitlementAllowed = "com.tamsk.private.Vessa.allowed";
inline constexpr const char* kVSAEntitlementLookup = "com.tamsk.private.Vessa.lookup";
inline constexpr const char* kVSAEntitlementOtherIdLookup = "com.tamsk.private.Vessa.otherIdLookup";
inline constexpr const char* kVSAEntitlementWipeContainer = "com.tamsk.private.Vessa.wipeContainer";
inline constexpr const char* kVSAEntitlementTestability = "com.tamsk.private.Vessa.testability";
inline constexpr const char* kVSAEntitlementUserManagedAssets =
    "com.tamsk.private.Vessa.userManagedAssets";
inline constexpr const char* kVSAEntitlementDeleteContainerContent =
    "com.tamsk.private.Vessa.deleteContainerContent";
inline constexpr const char* kVSAEntitlementDataMigration = "com.tamsk.private.Vessa.dataMigration";
inline constexpr const char* kVSAEntitlementStageSharedContent =
    "com.tamsk.private.Vessa.stageSharedContent";
