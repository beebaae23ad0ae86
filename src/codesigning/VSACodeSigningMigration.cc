#include "codesigning/VSACodeSigningMigration.h"

#include "base/VSALocks.h"
#include "base/VSALog.h"

namespace {
constexpr const char* kGroupIdMigration = "GroupIdMigration";
constexpr const char* kCodeSigningMigration = "CodeSigningMigration";

template <typename... A>
void logMigration(int level, const char* origin, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::CodeSignMapping, level, origin, format, args...);
}

// The data container class an app's entry records for its bundle class.
VSAContainerClass dataClassForBundleClass(VSAContainerClass bundleClass) {
  switch (bundleClass) {
    case VSAClass::kBundleApplication:
      return VSAClass::kDataApplication;
    case VSAClass::kBundlePlugin:
      return VSAClass::kDataPlugin;
    case VSAClass::kBundleVPNPlugin:
      return VSAClass::kDataVPNPlugin;
    default:
      return VSAClass::kUndefined;
  }
}
}  // namespace

VSACodeSigningMigration::VSACodeSigningMigration(
    std::shared_ptr<VSACodeSigningMapping> mapping, std::shared_ptr<VSAGroupManager> groupManager,
    std::shared_ptr<VSAContainerCache> containerCache,
    std::shared_ptr<VSAGlobalConfiguration> configuration,
    std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
    std::shared_ptr<const VSADeviceProperties> deviceProperties, VSAMigrationMarkers markers)
    : mapping_(std::move(mapping)),
      groupManager_(std::move(groupManager)),
      containerCache_(std::move(containerCache)),
      configuration_(std::move(configuration)),
      userIdentityCache_(std::move(userIdentityCache)),
      deviceProperties_(std::move(deviceProperties)),
      markers_(std::move(markers)) {}

bool VSACodeSigningMigration::performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
    VSACommandQueue& commandQueue) {
  VSAAllIdentifiersLockGuard lock(mapping_->locks(), true);
  bool multiUser = deviceProperties_->multiUserFlagsTopBitSet();
  bool ok = true;
  if (!multiUser) ok = migrateAppGroupIdsFromDataContainersToFile() && ok;
  ok = mapping_->migrateDataFromLegacyEntitlementsFileToCodeSigningFile() && ok;
  ok = migrateCachedCodeSigningInfoFromBundleContainersToMapping() && ok;
  // A step that failed kept its source for the next pass; a group that only
  // that source names would look unreferenced now, so reconciliation waits
  // for a pass that completes.
  if (!multiUser && ok)
    groupManager_->reconcileGroupContainersOfType(kVSAGroupTypeApplication, commandQueue);
  else if (!multiUser)
    logMigration(kVSALogError, "performAllCodeSigningMigrationAndReconciliationWithCommandQueue",
                 "Not reconciling application groups: the migration did not complete");
  return ok;
}

std::optional<std::vector<VSAConstMetadataRef>> VSACodeSigningMigration::containers(
    const VSAUserIdentityRef& user, VSAContainerClass c, VSAErrorRef* error) {
  return containerCache_->allContainersForUserIdentity(user, c, {}, error);
}

VSAResultCode VSACodeSigningMigration::clearInfoValue(const VSAMetadata& container,
                                                      const char* key) {
  VSAErrorRef error;
  auto fresh = VSAMetadata::rereadMetadataOfCachedContainer(container, *configuration_,
                                                            *userIdentityCache_, &error);
  if (!fresh)
    return error ? error->resultCode(VSAResult::kMetadataUnreadable)
                 : VSAResult::kMetadataUnreadable;
  VSAValue info =
      fresh->info() && fresh->info()->isDictionary() ? *fresh->info() : VSAValue::dictionary();
  info.remove(key);
  fresh->setInfo(std::move(info));
  if (!fresh->writeMetadataToDiskWithError(*configuration_, &error))
    return error ? error->resultCode(VSAResult::kWriteFailed) : VSAResult::kWriteFailed;
  if (!containerCache_->addContainerMetadata(*fresh, fresh->url(), {.updateSandbox = true}, &error))
    return VSAResult::kCacheAddFailed;
  return VSAResult::kSuccess;
}

bool VSACodeSigningMigration::migrateAppGroupIdsFromDataContainersToFile() {
  const char* origin = "migrateAppGroupIdsFromDataContainersToFile";
  if (markers_.hasMigrationOccurredForType(kGroupIdMigration)) return true;
  logMigration(kVSALogNotice, origin, "Performing group ID migration");
  auto user = userIdentityCache_->userIdentityForLegacyMobileUser();
  bool ok = true;
  for (VSAContainerClass c :
       {VSAClass::kDataApplication, VSAClass::kDataPlugin, VSAClass::kDataVPNPlugin}) {
    VSAErrorRef error;
    auto list = containers(user, c, &error);
    if (!list) {
      logMigration(kVSALogError, origin,
                   "Failed to fetch list of containers for userId: 501, class %ld : %@",
                   static_cast<long>(c), error);
      ok = false;
      continue;
    }
    for (const auto& container : *list) {
      const VSAValue* ids =
          container->info() ? container->info()->get(kVSAGroupContainerIDsKey) : nullptr;
      if (!ids) continue;
      const std::string& id = container->identifier();
      logMigration(kVSALogDebug, origin,
                   "Data container for userId: 501, identifier %@ references container IDs: %@", id,
                   *ids);
      VSACodeSigningEntry entry(
          VSAValue::Dictionary{{kVSAEntitlementsKey,
                                VSAValue::Dictionary{{kVSAEntitlementApplicationGroups, *ids}}}},
          c);
      entry.setInvalid(true);  // keeps the references alive, is no real signature
      bool kept = false;
      VSAErrorRef addError;
      bool existed = mapping_->codeSigningEntryForIdentifier(id, nullptr).has_value();
      if (existed) {
        logMigration(
            kVSALogNotice, origin,
            "Deleting app group entitlements for %@ because we already have them in mapping", id);
      } else if (!mapping_->addLegacyEntryUnlessValid(id, entry, &kept, &addError, [&] {
                   logMigration(kVSALogNotice, origin, "Migrating app group entitlements for %@",
                                id);
                 })) {
        logMigration(kVSALogError, origin,
                     "Failed to write migrated group id info to DB for %@ : %@", id, addError);
        ok = false;
        continue;  // the value stays for the next run
      }
      VSAResultCode cleared = clearInfoValue(*container, kVSAGroupContainerIDsKey);
      if (cleared != VSAResult::kSuccess) {
        logMigration(kVSALogError, origin, "Failed to clear group id metadata for %@ : %llu", id,
                     cleared);
        ok = false;
      }
    }
  }
  return ok && markers_.setMigrationCompleteForType(kGroupIdMigration);
}

bool VSACodeSigningMigration::migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
  const char* origin = "migrateCachedCodeSigningInfoFromBundleContainersToMapping";
  if (markers_.hasMigrationOccurredForType(kCodeSigningMigration)) return true;
  logMigration(kVSALogNotice, origin, "Performing code signing migration");
  auto user = userIdentityCache_->defaultUserIdentity();
  bool ok = true;
  for (VSAContainerClass c : {VSAClass::kBundleApplication, VSAClass::kBundlePlugin,
                              VSAClass::kBundleVPNPlugin, VSAClass::kBundleFramework}) {
    VSAErrorRef error;
    auto list = containers(user, c, &error);
    if (!list) {
      logMigration(kVSALogError, origin, "Failed to fetch list of containers for class %llu : %@",
                   static_cast<unsigned long long>(c), error);
      ok = false;
      continue;
    }
    for (const auto& container : *list) {
      const VSAValue* cached =
          container->info() ? container->info()->get(kVSACachedCodeSigningInfoKey) : nullptr;
      if (!cached) continue;
      const std::string& id = container->identifier();
      // A value that is no dictionary describes no signature: nothing is
      // stored for it, and it is cleared like any other.
      if (cached->isDictionary()) {
        VSAValue info = *cached;
        if (const VSAValue* entitlements = cached->get("Entitlements")) {
          info.set(kVSAEntitlementsKey, *entitlements);
          info.remove("Entitlements");
        }
        bool kept = false;
        VSAErrorRef addError;
        if (!mapping_->addLegacyEntryUnlessValid(
                id, VSACodeSigningEntry(std::move(info), dataClassForBundleClass(c)), &kept,
                &addError, [&] {
                  logMigration(kVSALogNotice, origin, "Migrating code signing info for %@", id);
                })) {
          logMigration(kVSALogError, origin,
                       "Failed to write migrated cached cs info from bundle container to DB for "
                       "%@ : %@",
                       id, addError);
          ok = false;
          continue;
        }
        if (kept)
          logMigration(kVSALogNotice, origin,
                       "Deleting cached code signing info for %@ because we already have it in "
                       "mapping",
                       id);
      } else {
        logMigration(kVSALogNotice, origin,
                     "Clearing cached code signing info of %@ that is not a dictionary: %@", id,
                     *cached);
      }
      VSAResultCode cleared = clearInfoValue(*container, kVSACachedCodeSigningInfoKey);
      if (cleared != VSAResult::kSuccess) {
        logMigration(kVSALogError, origin, "Error setting info value for identity %@ : %llu",
                     container->containerIdentity()->description(), cleared);
        ok = false;
      }
    }
  }
  return ok && markers_.setMigrationCompleteForType(kCodeSigningMigration);
}
