#include "operations/VSASystemContainerRestore.h"

#include <sys/stat.h>

#include <cstring>
#include <optional>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSAContainerLookup.h"
#include "operations/VSAContainerMaintenance.h"

namespace {
constexpr const char* kOrigin = "VSAMoveSystemContainersIntoPlace";

template <typename... A>
void logRestore(int level, const char* origin, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::Startup, level, origin, format, args...);
}
}  // namespace

void VSASystemContainerRestore::moveSystemContainersIntoPlace() {
  auto perUser =
      services_.configuration->getPerUserConfigurationForUserIdentity(grants_.clientUserIdentity);
  if (!perUser) return;
  auto holding = holdingDirectory();
  if (!holding) return;
  std::string system = VSAPathJoin(*holding, "Data.inprogress");
  std::string group = VSAPathJoin(*holding, "Shared.inprogress");
  bool systemMoved = moveToInProgress(perUser->systemContainerBackupDirectory(), system,
                                      "Failed to move system containers to inprogress: %@");
  bool groupMoved = moveToInProgress(perUser->systemGroupContainerBackupDirectory(), group,
                                     "Failed to move shared system containers to inprogress: %@");
  if (systemMoved) {
    logRestore(kVSALogNotice, kOrigin, "Installing system containers");
    installAll(system, VSAClass::kSystemData, "Couldn't find any system containers at %@: %@");
    markRestored(system);
  }
  if (groupMoved) {
    logRestore(kVSALogNotice, kOrigin, "Installing system group containers");
    installAll(group, VSAClass::kSystemGroup,
               "Couldn't find any system shared containers at %@: %@");
    markRestored(group);
  }
  if (services_.configuration->isInternalImage()) return;  // kept for inspection
  for (const std::string& base : {perUser->systemContainerBackupBaseDirectory(), *holding}) {
    VSAErrorRef error;
    if (!services_.fileManager->removeItemAtURL(base, &error))
      logRestore(kVSALogError, kOrigin, "Failed to remove system container base dir %@: %@", base,
                 error);
  }
}

std::optional<std::string> VSASystemContainerRestore::holdingDirectory() {
  auto& fm = *services_.fileManager;
  std::string holding =
      VSAPathJoin(services_.configuration->libraryDirectory(), kVSASystemContainerRestoreDirName);
  VSAErrorRef error;
  // Durable before the backup is moved in: that rename syncs the holding
  // directory, not the entry naming it, and a holding directory lost in a
  // power loss would take the backup, gone from the user's home, with it.
  if (fm.createDurableDirectoryAtURL(holding, 0700, 0, kVSANoProtectionClass, &error) &&
      fm.restrictItemToRootAtURL(holding, &error))
    return holding;
  logRestore(kVSALogError, kOrigin, "Cannot restore system containers without %@: %@", holding,
             error);
  return std::nullopt;
}

bool VSASystemContainerRestore::moveToInProgress(const std::string& backup,
                                                 const std::string& inProgress,
                                                 const char* moveFailure) {
  auto& fm = *services_.fileManager;
  struct stat st {};
  std::string restored = restoredMarker(inProgress);
  if (fm.fileSystem().lstat(backup, &st) != 0) {
    // A restore a crash interrupted: its in-progress directory is all that
    // is left of the backup, so it is restored rather than thrown away. One
    // that completed (kept by internal builds) is not restored again.
    if (fm.fileSystem().lstat(inProgress, &st) != 0 || fm.fileSystem().lstat(restored, &st) == 0 ||
        !acceptBackup(inProgress, inProgress))
      return false;
    logRestore(kVSALogNotice, kOrigin, "Resuming the interrupted restore of %@", inProgress);
    return true;
  }
  VSAErrorRef error;
  // The marker goes first: a new backup in the in-progress directory must
  // never pass for a completed restore.
  if (!fm.removeItemAtURL(restored, &error)) {
    logRestore(kVSALogError, kOrigin, "Failed to remove %@: %@", restored, error);
    return false;
  }
  if (!fm.removeItemAtURL(inProgress, &error))
    logRestore(kVSALogError, kOrigin, "Failed to remove existing inprogress system containers: %@",
               error);
  // The backup lies in the user's home, where the user can put anything at
  // its name at any moment: whatever is there is first taken out of the
  // user's reach (one rename, never a copy) and only then looked at, so the
  // directory checked is the directory restored. Its parents are taken without
  // following a link, so a swapped parent cannot bring in another directory.
  if (int rc = VSARenameWithoutLinks(fm.fileSystem(), backup, inProgress)) {
    logRestore(kVSALogError, kOrigin, moveFailure,
               VSAError::posix(rc, "moveToInProgress", __LINE__,
                               VSAFormat("%@ -> %@: %s", backup, inProgress, std::strerror(rc))));
    return false;
  }
  return acceptBackup(inProgress, backup);
}

bool VSASystemContainerRestore::acceptBackup(const std::string& inProgress,
                                             const std::string& shownAs) {
  auto& fm = *services_.fileManager;
  struct stat st {};
  int rc = fm.fileSystem().lstat(inProgress, &st);
  VSAErrorRef error;
  // Only what root backed up goes into system containers: a backup that
  // anyone else could have written is not restored, and does not stay.
  if (rc != 0 || !S_ISDIR(st.st_mode) || st.st_uid != 0 || (st.st_mode & 022)) {
    logRestore(kVSALogError, kOrigin,
               "Not restoring %@: not a directory owned by root and writable by root only",
               shownAs);
    if (rc == 0 && !fm.removeItemAtURL(inProgress, &error))
      logRestore(kVSALogError, kOrigin, "Failed to remove %@: %@", inProgress, error);
    return false;
  }
  // System containers hold nobody else's items: the whole backup is given
  // to root before any of it moves into a live container.
  if (!fm.standardizeOwnershipAtURL(inProgress, 0, 0, &error)) {
    logRestore(kVSALogError, kOrigin, "Not restoring %@: cannot give it to root: %@", shownAs,
               error);
    return false;
  }
  return true;
}

std::string VSASystemContainerRestore::restoredMarker(const std::string& inProgress) {
  return inProgress + ".restored";
}

void VSASystemContainerRestore::markRestored(const std::string& inProgress) {
  VSAErrorRef error;
  if (!services_.fileManager->writeFileAtomicallyAtURL(restoredMarker(inProgress), {}, 0600,
                                                       std::nullopt, &error))
    logRestore(kVSALogError, kOrigin, "Failed to record the completed restore of %@: %@",
               inProgress, error);
}

void VSASystemContainerRestore::installAll(const std::string& inProgress, VSAContainerClass c,
                                           const char* listFailure) {
  VSAErrorRef error;
  auto entries = services_.fileManager->urlsForItemsInDirectoryAtURL(inProgress, &error);
  if (!entries) {
    logRestore(kVSALogError, kOrigin, listFailure, inProgress, error);
    return;
  }
  for (const auto& entry : *entries) _moveSystemContainerIntoPlace(entry.path, c);
}

void VSASystemContainerRestore::_moveSystemContainerIntoPlace(const std::string& entry,
                                                              VSAContainerClass c) {
  const char* origin = "_moveSystemContainerIntoPlace";
  auto& fm = *services_.fileManager;
  std::string identifier = VSALastPathComponent(entry);
  std::string failed = VSADirectoryName(entry) + ".failed";
  VSAResultCode code = VSAResult::kSuccess;
  auto identity = VSAContainerIdentity::containerIdentityWithIdentifier(
      identifier, c, *services_.userIdentityCache, &code);
  if (!identity) {
    logRestore(kVSALogError, origin, "Failed to create container identity %@: %llu", identifier,
               code);
    return;
  }
  auto live = VSAContainerLookup(services_, grants_)
                  .createOrLookupContainerWithContainerIdentity(identity,
                                                                {.createIfNecessary = true}, &code);
  if (!live) {
    logRestore(kVSALogError, origin, "Failed to create system container %@: %llu", identifier,
               code);
    return;
  }
  logRestore(kVSALogNotice, origin, "Restoring container for %@ at %@ to %@", identifier, entry,
             live->url());
  std::vector<VSADirectoryEntry> items;
  if (int rc = fm.fileSystem().readDirectory(entry, &items)) {
    logRestore(kVSALogError, origin,
               "Failed to enumerate contents of restored system container %@ at %@: %@", identifier,
               entry, std::string(std::strerror(rc)));
    return _moveFailedPathAside(entry, failed);
  }
  for (const auto& item : items) {
    // The live container keeps its own identity.
    if (item.name == kVSAMetadataFileName) continue;
    std::string from = VSAPathJoin(entry, item.name), to = VSAPathJoin(live->url(), item.name);
    VSAErrorRef error;
    if (!fm.removeItemAtURL(to, &error)) {
      logRestore(kVSALogError, origin, "Failed to remove destination %@:%@: %@", identifier, to,
                 error);
      _moveFailedPathAside(from, failed);
    } else if (!fm.moveItemAtURL(from, to, &error)) {
      logRestore(kVSALogError, origin,
                 "Failed to move file in restored system container %@:%@ to destination %@: %@",
                 identifier, from, to, error);
      _moveFailedPathAside(from, failed);
    }
  }
  code = VSAResult::kSuccess;
  if (!VSAContainerMaintenance(services_).recreateDefaultStructureWithContainerIdentity(
          live->containerIdentity(), &code))
    logRestore(kVSALogError, origin, "Error processing restored system container %@: %llu",
               identifier, code);
}

void VSASystemContainerRestore::_moveFailedPathAside(const std::string& item,
                                                     const std::string& failureDirectory) {
  const char* origin = "_moveFailedPathAside";
  auto& fm = *services_.fileManager;
  VSAErrorRef error;
  // Made durably: what is moved into it was a backup and must not vanish with it.
  if (!fm.createDurableDirectoryAtURL(failureDirectory, 0700, 0, kVSANoProtectionClass, &error)) {
    logRestore(kVSALogError, origin, "Failed to create %@: %@", failureDirectory, error);
    return;
  }
  std::string to = VSAPathJoin(failureDirectory, VSALastPathComponent(item));
  if (!fm.moveItemAtURL(item, to, &error))
    logRestore(kVSALogError, origin, "Failed to move %@ to %@: %@", item, to, error);
}
