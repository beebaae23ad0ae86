// Reinstallation of backed-up system and system-group containers at the
// first start after a boot. Backups live in the current user's
// "Library/Backup/SystemContainers" (system containers) and its system-group
// sibling, one directory per identifier. The user owns that place and can
// swap whatever sits there at any moment, so nothing is decided about a
// backup while it is there: each backup directory is first renamed into the
// daemon's own "SystemContainerRestore" directory (root's, mode 0700) as
// "Data.inprogress" or "Shared.inprogress" (an older in-progress copy, left
// by a crash, is removed first; without a new backup, an in-progress
// directory left by a crash is restored instead of being lost, while one
// whose restore completed, marked "<inprogress>.restored", is left as it
// is). Only there is
// it checked: a backup that is not a directory owned by root and writable by
// root only is not restored and is removed; an accepted one is given to root
// whole. Then every entry is restored: the live container is created or
// looked up, each item of the backup replaces the live item of the same name,
// and the default structure (with the system containers' owners and access
// lists) is made again. What cannot be restored goes to
// "<inprogress>.failed". Unless the build is internal the whole backup base
// directory and the restore directory are removed at the end (internal
// builds keep them for inspection).
#pragma once

#include <optional>
#include <string>

#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

// The daemon's directory (in its library) that holds backups while they are restored.
inline constexpr const char* kVSASystemContainerRestoreDirName = "SystemContainerRestore";

class VSASystemContainerRestore {
 public:
  VSASystemContainerRestore(const VSAOperationServices& services, const VSAOperationGrants& grants)
      : services_(services), grants_(grants) {}

  void moveSystemContainersIntoPlace();
  void _moveSystemContainerIntoPlace(const std::string& entry, VSAContainerClass containerClass);
  void _moveFailedPathAside(const std::string& item, const std::string& failureDirectory);

 private:
  // The restore directory, made root's with mode 0700; nothing when it cannot be.
  [[nodiscard]] std::optional<std::string> holdingDirectory();
  // Renames `backup` to `inProgress` and accepts it there (or an interrupted
  // restore's `inProgress`); true when it is to be restored.
  [[nodiscard]] bool moveToInProgress(const std::string& backup, const std::string& inProgress,
                                      const char* moveFailure);
  // Whether the backup now at `inProgress` (shown in logs as `shownAs`) may
  // be restored; gives it to root when so, removes it when not.
  [[nodiscard]] bool acceptBackup(const std::string& inProgress, const std::string& shownAs);
  void installAll(const std::string& inProgress, VSAContainerClass c, const char* listFailure);
  // "<inProgress>.restored", written once every entry of `inProgress` was
  // restored: an in-progress directory beside it is a completed restore
  // (kept by internal builds), not one a crash interrupted.
  static std::string restoredMarker(const std::string& inProgress);
  void markRestored(const std::string& inProgress);

  const VSAOperationServices& services_;
  const VSAOperationGrants& grants_;
};
