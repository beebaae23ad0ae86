#include "operations/VSABootKeeper.h"

#include <cerrno>
#include <set>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAProgressLog.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSAContainerMaintenance.h"
#include "operations/VSAReplaceOperation.h"
#include "operations/VSARetryTest.h"
#include "operations/VSASystemContainerRestore.h"

// Steps not built yet (build-upgrade migration, system container restore,
// group reconciliation, orphan scans) say so in the log; the cleanups always
// complete so that start-up posts its notifications.
void VSABootKeeper::rebootKeeperSetup(const VSAOperationGrants& grants) {
  VSASystemContainerRestore(services_, grants).moveSystemContainersIntoPlace();
  if (!services_.deviceProperties->multiUserFlagsTopBitSet()) return;
  VSACommandQueue queue;
  services_.groups.reconcileGroupContainersOfType(kVSAGroupTypeApplication, queue);
  VSAResultCode code = VSAResult::kSuccess;
  if (!queue.executeAllUntilExhaustedOrError(&code))
    VSALogIn(VSALogCategory::Startup, kVSALogError, "rebootKeeperSetup",
             "Failed to remove unreferenced application groups: %llu",
             static_cast<unsigned long long>(code));
}

void VSABootKeeper::_regenerateAllSystemContainerPaths(const VSAOperationGrants& grants) {
  const char* origin = "_regenerateAllSystemContainerPaths";
  VSALogIn(VSALogCategory::Startup, kVSALogNotice, origin,
           "Rolling system container directory UUIDs on disk");
  VSAContainerMaintenance maintenance(services_);
  for (VSAContainerClass c : {VSAClass::kSystemData, VSAClass::kSystemGroup}) {
    VSAErrorRef error;
    auto all = services_.containerCache->allContainersForUserIdentity(grants.clientUserIdentity, c,
                                                                      {}, &error);
    if (!all) {
      VSALogIn(VSALogCategory::Startup, kVSALogError, origin,
               "Failed to get list of system containers for migration: %@", error);
      continue;
    }
    for (const auto& m : *all) {
      const std::string& id = m->identifier();
      if (id.empty() || services_.wellknown.containerIdIsWellknown(id, c) ||
          id == kVSAAnalyticsSystemGroupIdentifier)
        continue;
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
  if (!services_.dataProtection.restartPendingDataProtectionOperationsWithError(&error))
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
  if (!deathRow._moveItemAtURLToDeathRow(transient, {}, &error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed to delete shared transient URL %@ : %@", transient, error);
  if (auto legacy = config.legacyTransientBundleDirectory()) {
    VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
             "Sentencing legacy transient bundle directory [%@] to final deletion", *legacy);
    if (!deathRow._moveItemAtURLToDeathRow(*legacy, {}, &error))
      VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
               "Failed to delete legacy shared transient bundle URL %@ : %@", *legacy, error);
  }
  std::string bundles = config.transientBundleDirectory();
  if (!deathRow._moveItemAtURLToDeathRow(bundles, {}, &error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed to delete shared transient bundle URL %@ : %@", bundles, error);
  services_.userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const VSAUserIdentityRef& user) {
        auto perUser = config.getPerUserConfigurationForUserIdentity(user);
        if (!perUser || !perUser->existsUserBaseDirectory()) return;
        std::string userTransient = perUser->transientDirectory();
        VSAErrorRef userError;
        if (!deathRow._moveItemAtURLToDeathRow(userTransient, {}, &userError))
          VSALogIn(VSALogCategory::Startup, kVSALogError, "rebootKeeperCleanupWithCompletion",
                   "Failed to delete per-user transient URL %@ : %@", userTransient, userError);
      });
  // One serial queue carries the scans, the advance-copy removal and the
  // completion, in this order; requests are served meanwhile.
  auto queue = VSAWorkQueue::create("com.tamsk.vessad.bootcleanup", VSAWorkQueue::Kind::Serial,
                                    VSAWorkQueue::global(VSAWorkQueue::Priority::Background));
  auto progress = std::make_shared<VSAProgressLog>(
      VSALogCategory::Startup, "rebootKeeperCleanupWithCompletion",
      "Boot cleanup: checking container directories", 0, "entries");
  uint64_t total = 0;
  auto scan = [&](const VSAUserIdentityRef& user, VSAContainerClass c) {
    auto directory = config.containerDirectoryURLForUserIdentity(user, c, false);
    if (!directory) return;
    VSAErrorRef listError;
    auto items = services_.fileManager->urlsForItemsInDirectoryAtURL(*directory, &listError);
    if (!items) {
      if (!(listError && listError->domain() == kVSAPOSIXErrorDomain &&
            listError->code() == ENOENT))
        VSALogIn(VSALogCategory::Startup, kVSALogError, "rebootKeeperCleanupWithCompletion",
                 "Failed to get items : %@", listError);
      return;
    }
    std::vector<std::string> entries;
    for (const auto& item : *items) entries.push_back(item.path);
    progress->setTotal(total += entries.size());
    // The services outlive the daemon's queues; this keeper object does not.
    queue->async([services = &services_, keep = queue, entries = std::move(entries), c, progress] {
      VSABootKeeper(*services)._cleanupOrphanedDataForDirectories(entries, c, progress.get());
    });
  };
  services_.userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const VSAUserIdentityRef& user) {
        auto perUser = config.getPerUserConfigurationForUserIdentity(user);
        if (!perUser || !perUser->existsUserBaseDirectory()) return;
        for (VSAContainerClass c : kVSAPerUserContainerClasses) scan(user, c);
      });
  auto defaultUser = services_.userIdentityCache->defaultUserIdentity();
  for (VSAContainerClass c : kVSAGlobalContainerClasses) scan(defaultUser, c);
  queue->async([services = &services_, keep = queue] {
    VSABootKeeper(*services)._cleanupOprhanedCodeSigningMappingData();
  });
  queue->async([token, keep = queue, progress = std::move(progress),
                completion = std::move(completion)]() mutable {
    progress.reset();  // its closing line comes before the completion's
    if (completion) completion();
  });
}

bool VSABootKeeper::_isOrphanedEntry(const std::string& url, VSAContainerClass c, bool* valid) {
  auto& fm = *services_.fileManager;
  // A live container (most entries) costs one status call: its metadata
  // file exists, so the entry does too.
  *valid = VSAContainerCache::containerURLIsValidForContainerClass(url, c, services_.wellknown);
  if (*valid && fm.itemExistsAtURL(VSAPathJoin(url, kVSAMetadataFileName))) return false;
  if (fm.itemDoesNotExistAtURL(url)) {
    VSALogIn(VSALogCategory::Startup, kVSALogDebug, "_cleanupOrphanedDataForDirectories",
             "Ignoring deleted container path during cleanup: [%@]", url);
    return false;
  }
  return true;
}

void VSABootKeeper::_cleanupOrphanedDataForDirectories(const std::vector<std::string>& entries,
                                                       VSAContainerClass c,
                                                       VSAProgressLog* progress) {
  const char* origin = "_cleanupOrphanedDataForDirectories";
  bool valid = false;
  std::vector<std::string> suspects;
  for (const auto& url : entries) {
    if (progress) progress->advance();
    if (_isOrphanedEntry(url, c, &valid)) suspects.push_back(url);
  }
  if (suspects.empty()) return;
  // Requests are served while the scan runs. An operation that moves
  // containers (creation, replace and the wipe that uses it, deletion, a
  // new directory UUID) holds the all-identifiers lock for writing, and may
  // leave a live path without its metadata file in between: a wipe empties
  // it between its two renames. Under the lock for reading no such
  // operation is half done, so each suspect is judged again there and
  // moved before the lock goes.
  VSAAllIdentifiersLockGuard lock(*services_.locks, false);
  std::vector<std::string> orphans;
  for (const auto& url : suspects) {
    if (!_isOrphanedEntry(url, c, &valid)) continue;
    if (valid)
      VSALogIn(VSALogCategory::Startup, kVSALogError, origin,
               "Deleting orphaned data missing a metadata file at: %@", url);
    if (services_.configuration->isInternalImage()) {
      VSALogIn(VSALogCategory::Startup, kVSALogError, origin,
               "***INTERNAL BUILD REQUEST: please file a problem report with the data below");
      VSALogIn(VSALogCategory::Startup, kVSALogError, origin,
               "\tSomeone is writing invalid data to a container, which has now been orphaned. "
               "Here are the invalid files:");
      services_.fileManager->printDirectoryStructureAtURL(url);
      VSALogIn(VSALogCategory::Startup, kVSALogError, origin, "***END INTERNAL BUILD REQUEST");
    }
    orphans.push_back(url);
  }
  // One directory on death row for this batch (entries of one class
  // directory have distinct names); an orphan whose move a crash undoes is
  // found again at the next boot, so the moves are not synced.
  if (!services_.deathRow->_moveEntriesToDeathRowWithoutSync(orphans))
    VSALogIn(VSALogCategory::Startup, kVSALogError, origin,
             "Some orphans stay in place until the next boot finds them again");
}

void VSABootKeeper::_cleanupOprhanedCodeSigningMappingData() {
  VSAErrorRef error;
  if (!services_.codeSigningChanges.removeAllAdvanceCopiesWithError(&error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Could not remove advance copies of code sign data: %@", error);
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
        for (VSAContainerClass c : kVSAPerUserContainerClasses)
          collect(config.stagingDirectoryURLForUserIdentity(user, c),
                  "Failed to get items at per-user staging URL: %@ : %@");
      });
  // Staging directories are never resumed: whatever a crash left there goes,
  // except an old container that a replace file still names (its recovery
  // failed or was not reached): it waits there for the next start's. When
  // the replace files cannot all be read, staging stays as it is this time.
  auto waiting = VSAReplaceOperation(services_).stagingURLsAwaitingRecovery();
  if (!waiting) {
    VSALogIn(VSALogCategory::Startup, kVSALogError, "keeperCleanupWithCompletion",
             "Keeping every staging entry: the replace files could not all be read");
    staged.clear();
  }
  for (const auto& url : waiting.value_or(std::set<std::string>{}))
    if (staged.erase(url))
      VSALogIn(VSALogCategory::Startup, kVSALogError, "keeperCleanupWithCompletion",
               "Keeping %@ for the recovery of an unfinished replace", url);
  auto deathRow = services_.deathRow;
  deathRow->_sharedBackgroundQueue()->async(
      [deathRow, staged = std::move(staged), token, completion = std::move(completion)] {
        for (const auto& item : staged) {
          VSAErrorRef error;
          if (!deathRow->_moveItemAtURLToDeathRow(item, {}, &error))
            VSALog(kVSALogError, "keeperCleanupWithCompletion", "%@", error);
        }
        deathRow->deleteContainersOnDeathRowWithCompletion(
            [token, completion](VSAResultCode) { completion(); });
      });
}
