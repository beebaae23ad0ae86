// Maintenance of one existing container: a new UUID name for its directory
// (under the all-identifiers write lock, since its path changes under
// readers), its default sub-directories made again (existing ones kept;
// ACLs of system containers normalised), and one value of its metadata info
// dictionary read or written (under the container's identifier lock, keyed
// by its UUID). A container that the identity does not name is 21.
//
// The identity may be plain: the container it names is looked up first to
// learn the UUID to lock, and looked up again under the lock (21 if it has
// been replaced meanwhile). Info values are read from and written to the
// metadata file itself, so that a change made by another operation under
// the same lock is never lost; the file is rewritten through staging.
#pragma once

#include <optional>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAMetadata.h"
#include "operations/VSAOperationServices.h"

class VSAContainerMaintenance {
 public:
  explicit VSAContainerMaintenance(const VSAOperationServices& services) : services_(services) {}

  [[nodiscard]] bool regenerateDirectoryUUIDWithContainerIdentity(
      const VSAContainerIdentityRef& identity, VSAResultCode* withError);
  [[nodiscard]] bool recreateDefaultStructureWithContainerIdentity(
      const VSAContainerIdentityRef& identity, VSAResultCode* withError);
  // 38 for a key that is not a string; 24 (not logged as an error) when unset.
  [[nodiscard]] std::optional<VSAValue> infoValueForKey(
      const VSAValue* key, const VSAContainerIdentityRef& containerIdentity, bool useLocking,
      VSAResultCode* withError);
  // No value removes the key.
  [[nodiscard]] bool setInfoValue(const VSAValue* value, const VSAValue* forKey,
                                  const VSAContainerIdentityRef& containerIdentity, bool useLocking,
                                  VSAResultCode* withError);

 private:
  [[nodiscard]] VSAMetadataRef find(const VSAContainerIdentityRef& identity, const char* origin,
                                    VSAResultCode* withError);
  // find() under the lock keyed by `key`: 21 if the container found is not the one locked.
  [[nodiscard]] VSAMetadataRef findLocked(const VSAContainerIdentityRef& identity,
                                          const std::optional<std::string>& key, const char* origin,
                                          VSAResultCode* withError);
  // The UUID string that keys the container's identifier lock.
  [[nodiscard]] std::optional<std::string> lockKey(const VSAContainerIdentityRef& identity,
                                                   const char* origin, VSAResultCode* withError);
  // The container's metadata as its file holds it now.
  [[nodiscard]] VSAMetadataRef reread(const VSAMetadata& cached, const char* origin,
                                      VSAResultCode* withError);

  const VSAOperationServices& services_;
};
