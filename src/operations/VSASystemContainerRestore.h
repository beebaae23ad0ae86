// Reinstallation of backed-up system and system-group containers at the
// first start after a boot. Backups live in the current user's
// "Library/Backup/SystemContainers" (system containers) and its system-group
// sibling, one directory per identifier. Each backup directory is first
// renamed to "<dir>.inprogress" (an older in-progress copy, left by a crash,
// is removed first; without a new backup, an in-progress directory left by a
// crash is restored instead of being lost), then every entry is restored: the live container is
// created or looked up, each item of the backup replaces the live item of
// the same name, and the default structure is made again. What cannot be
// restored goes to "<inprogress>.failed". Unless the build is internal the
// whole backup base directory is removed at the end (internal builds keep
// it for inspection). A backup directory that is not owned by root, or that
// group or others may write, is not restored (it sits in a user's home).
#pragma once

#include <string>

#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

class VSASystemContainerRestore {
 public:
  VSASystemContainerRestore(const VSAOperationServices& services, const VSAOperationGrants& grants)
      : services_(services), grants_(grants) {}

  void moveSystemContainersIntoPlace();
  void _moveSystemContainerIntoPlace(const std::string& entry, VSAContainerClass containerClass);
  void _moveFailedPathAside(const std::string& item, const std::string& failureDirectory);

 private:
  // Renames `backup` to its in-progress name; true when it was moved.
  bool moveToInProgress(const std::string& backup, const char* moveFailure);
  void installAll(const std::string& inProgress, VSAContainerClass c, const char* listFailure);

  const VSAOperationServices& services_;
  const VSAOperationGrants& grants_;
};
