#include "operations/VSABootKeeper.h"

#include <set>

#include "base/VSALog.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSAContainerMaintenance.h"
#include "operations/VSAReplaceOperation.h"
#include "operations/VSARetryTest.h"

// Steps not built yet (build-upgrade migration, system container restore,
// group reconciliation, orphan scans) say so in the log; the cleanups always
// complete so that start-up posts its notifications.
void VSABootKeeper::rebootKeeperSetup() {
  VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
           "First-boot setup: system container restore and group reconciliation are not "
           "available in this build");
}

void VSABootKeeper::_regenerateAllSystemContainerPaths(const VSAOperationGrants& grants) {
  const char* origin = "_regenerateAllSystemContainerPaths";
  VSAContainerMaintenance maintenance(services_);
  for (VSAContainerClass c : {12, 13}) {
    VSAErrorRef error;
    auto all = services_.containerCache->allContainersForUserIdentity(grants.clientUserIdentity, c,
                                                                      false, false, &error);
    if (!all) {
      VSALogIn(VSALogCategory::Startup, kVSALogError, origin,
               "Failed to get list of system containers for migration: %@", error);
      continue;
    }
    for (const auto& m : *all) {
      const std::string& id = m->identifier();
      bool wellKnown =
          services_.wellknownContainerForId && services_.wellknownContainerForId(id, c);
      if (id.empty() || wellKnown || id == kVSAAnalyticsSystemGroupIdentifier) continue;
      VSAResultCode code = VSAResult::kSuccess;
      if (!maintenance.regenerateDirectoryUUIDWithContainerIdentity(m->containerIdentity(), &code))
        VSALogIn(VSALogCategory::Startup, kVSALogError, origin,
                 "Failed to regenerate directory UUID for identifier: %@, class: %llu", id,
                 static_cast<unsigned long long>(c));
    }
  }
}

void VSABootKeeper::keeperSetup() {
  VSAErrorRef error;
  if (!VSAReplaceOperation(services_)._recoverFromReplaceOperationsWithError(&error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed recovering from replace operations: %@", error);
  error = nullptr;
  if (!services_.restartPendingDataProtectionOperations(&error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed restarting pending data protection operations: %@", error);
  // Only internal builds start crash-retry tests; elsewhere a journal is never acted on.
  VSAResultCode retry = VSAResult::kSuccess;
  if (services_.configuration->isInternalImage() &&
      !VSARetryTest(services_).resumeRetryTestIfPending(&retry))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed resuming the retry test: %llu", retry);
}

void VSABootKeeper::rebootKeeperCleanupWithCompletion(std::function<void()> completion) {
  auto& config = *services_.configuration;
  auto& deathRow = *services_.deathRow;
  auto token = services_.transactions->open();
  // Transient containers do not survive a reboot.
  VSAErrorRef error;
  std::string transient = config.transientDirectory();
  if (!deathRow._moveItemAtURLToDeathRow(transient, true, false, &error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed to delete shared transient URL %@ : %@", transient, error);
  if (auto legacy = config.legacyTransientBundleDirectory()) {
    VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
             "Sentencing legacy transient bundle directory [%@] to final deletion", *legacy);
    if (!deathRow._moveItemAtURLToDeathRow(*legacy, true, false, &error))
      VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
               "Failed to delete legacy shared transient bundle URL %@ : %@", *legacy, error);
  }
  std::string bundles = config.transientBundleDirectory();
  if (!deathRow._moveItemAtURLToDeathRow(bundles, true, false, &error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed to delete shared transient bundle URL %@ : %@", bundles, error);
  services_.userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const VSAUserIdentityRef& user) {
        auto perUser = config.getPerUserConfigurationForUserIdentity(user);
        if (!perUser || !perUser->existsUserBaseDirectory()) return;
        std::string userTransient = perUser->transientDirectory();
        VSAErrorRef userError;
        if (!deathRow._moveItemAtURLToDeathRow(userTransient, true, false, &userError))
          VSALogIn(VSALogCategory::Startup, kVSALogError, "rebootKeeperCleanupWithCompletion",
                   "Failed to delete per-user transient URL %@ : %@", userTransient, userError);
      });
  VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
           "First-boot cleanup: orphaned-data scans are not available in this build");
  VSADeathRow::_sharedBackgroundQueue()->async(
      [token, completion = std::move(completion)] { completion(); });
}

void VSABootKeeper::keeperCleanupWithCompletion(std::function<void()> completion) {
  auto token = services_.transactions->open();
  auto& config = *services_.configuration;
  auto& fm = *services_.fileManager;
  std::set<std::string> staged;  // per-class staging may share a directory
  auto collect = [&](const std::string& directory, const char* failureFormat) {
    VSAErrorRef error;
    auto items = fm.urlsForItemsInDirectoryAtURL(directory, &error);
    if (!items) {
      if (!(error && error->domain() == kVSAPOSIXErrorDomain && error->code() == ENOENT))
        VSALogIn(VSALogCategory::Startup, kVSALogError, "keeperCleanupWithCompletion",
                 failureFormat, directory, error);
      return;
    }
    for (const auto& item : *items) staged.insert(item.path);
  };
  collect(config.stagingDirectory(), "Failed to get items at global staging URL: %@ : %@");
  services_.userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const VSAUserIdentityRef& user) {
        for (VSAContainerClass c : {2, 4, 6, 7, 9, 10, 11})
          collect(config.stagingDirectoryURLForUserIdentity(user, c),
                  "Failed to get items at per-user staging URL: %@ : %@");
      });
  // Staging directories are never resumed: whatever a crash left there goes.
  auto deathRow = services_.deathRow;
  VSADeathRow::_sharedBackgroundQueue()->async(
      [deathRow, staged = std::move(staged), token, completion = std::move(completion)] {
        for (const auto& item : staged) {
          VSAErrorRef error;
          if (!deathRow->_moveItemAtURLToDeathRow(item, true, false, &error))
            VSALog(kVSALogError, "keeperCleanupWithCompletion", "%@", error);
        }
        deathRow->deleteContainersOnDeathRowWithCompletion(
            [token, completion](VSAResultCode) { completion(); });
      });
}
