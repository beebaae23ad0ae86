// Making a container's directories: the top-level directory (owner by class:
// the installer for bundles, root for system containers, the user otherwise)
// and the default sub-directories of its class with their modes, owners,
// protection classes and, for system containers, their ACLs. Used by
// creation and by recreating a container's default structure; existing
// sub-directories are kept. Stateless apart from its services; thread-safe.
#pragma once

#include <string>
#include <vector>

#include "base/VSAError.h"
#include "model/VSAMetadata.h"
#include "operations/VSAOperationServices.h"

class VSAContainerDirectories {
 public:
  explicit VSAContainerDirectories(const VSAOperationServices& services) : services_(services) {}

  [[nodiscard]] bool _createTopLevelContainerDirectory(const std::string& url,
                                                       VSAContainerClass containerClass,
                                                       uid_t owner, gid_t group,
                                                       VSAErrorRef* error);
  // `durable`: each directory made is synced into its parent before the
  // call returns, for a live container; one built in staging is synced
  // before the rename that commits it, through the directories that hold
  // what was made (`names`, if given, receives the sub-directories' names,
  // relative to `url`).
  [[nodiscard]] bool _createSubDirectories(const std::string& url,
                                           const VSAMetadata& containerMetadata, VSAErrorRef* error,
                                           bool durable = false,
                                           std::vector<std::string>* names = nullptr);
  // The protection class recorded in the metadata, else the one the
  // identifier's entitlements ask for; 0 for global classes.
  int32_t _dataProtectionClassForContainerMetadata(const VSAMetadata& metadata);

 private:
  const VSAOperationServices& services_;
};
