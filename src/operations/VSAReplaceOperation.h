// Replace: puts one existing container (the new one, typically a fresh
// transient container) in the place of another of the same class and user
// (the old one). The exchange is two renames, journalled in a replace file
// written before the first: old -> staging, new -> destination. The whole
// operation holds the all-identifiers write lock.
//
// With `preserveOldUUID` the result stands where the old container stood
// and keeps the old container's UUID (the content wipe); the new
// container's metadata file is rewritten with that UUID before anything
// moves, so a crash at any point leaves either the old container or the
// finished result at the old path. Without it, the result goes to the class
// directory of the new container's transient state under the new
// identity's UUID.
//
// A failure after the old container has been moved aside moves it back and
// returns it to the cache; only if that fails too do the staging directory
// and the replace file stay, for the next start's recovery. Recovery runs
// once at start-up, before staging directories are cleaned; a recovery that
// fails keeps its replace file, and the staging cleanup keeps what such a
// file names, so a later start tries again.
#pragma once

#include <optional>
#include <set>
#include <string>

#include "base/VSAError.h"
#include "model/VSAContainerIdentity.h"
#include "operations/VSAOperationServices.h"

class VSAReplaceOperation {
 public:
  explicit VSAReplaceOperation(const VSAOperationServices& services) : services_(services) {}

  [[nodiscard]] bool replaceContainerIdentity(const VSAContainerIdentityRef& oldIdentity,
                                              const VSAContainerIdentityRef& withContainerIdentity,
                                              bool preserveOldUUID, bool startDeletionThread,
                                              VSAResultCode* withError);
  // Puts back every old container that a replace file says was moved aside
  // and not replaced, then discards the replace files.
  [[nodiscard]] bool _recoverFromReplaceOperationsWithError(VSAErrorRef* error);
  // The staging directories that the replace files still on disk name: the
  // old containers that a recovery could not yet put back (or did not reach)
  // wait there for the next start and must survive the staging cleanup.
  // Nothing when a replace file or the directory cannot be read: then any
  // staging entry may be one of them.
  [[nodiscard]] std::optional<std::set<std::string>> stagingURLsAwaitingRecovery();

 private:
  const VSAOperationServices& services_;
};
