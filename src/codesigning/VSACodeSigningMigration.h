// The full pass of the legacy code-signing migrations, run by the container
// migrator with its command queue: group identifiers kept in data
// containers' metadata, the legacy entitlements file and code-signing info
// cached in bundle containers' metadata all move into the code-signing
// database, then application groups are reconciled (only after a pass in
// which every step succeeded: a step that failed keeps its source for the
// next pass, and the groups only that source names are still in use). The
// whole pass holds the all-identifiers lock for writing.
//
// Group identifiers (marker "GroupIdMigration") and cached code-signing info
// (marker "CodeSigningMigration") run once each: the marker is set only when
// every container was handled, and a re-run after an interruption is safe
// (an identifier that has a valid entry keeps it, and an info value is
// cleared only after its content is in the database). In multi-user mode
// (the multi-user flags' top bit) neither the group identifier migration nor
// the reconciliation runs.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "codesigning/VSACodeSigningMapping.h"
#include "codesigning/VSAGroupManager.h"
#include "model/VSAContainerCache.h"
#include "platform/VSADeviceProperties.h"

inline constexpr const char* kVSACachedCodeSigningInfoKey =
    "com.tamsk.Ferrox.CachedCodeSigningInfo";
inline constexpr const char* kVSAGroupContainerIDsKey = "com.tamsk.Ferrox.GroupContainerIDs";

// Where the pass records its markers (the system migration status).
struct VSAMigrationMarkers {
  std::function<bool(const std::string& type)> hasMigrationOccurredForType;
  std::function<bool(const std::string& type)> setMigrationCompleteForType;
};

class VSACodeSigningMigration {
 public:
  VSACodeSigningMigration(std::shared_ptr<VSACodeSigningMapping> mapping,
                          std::shared_ptr<VSAGroupManager> groupManager,
                          std::shared_ptr<VSAContainerCache> containerCache,
                          std::shared_ptr<VSAGlobalConfiguration> configuration,
                          std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
                          std::shared_ptr<const VSADeviceProperties> deviceProperties,
                          VSAMigrationMarkers markers);

  // True when every step succeeded.
  bool performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
      VSACommandQueue& commandQueue);
  bool migrateAppGroupIdsFromDataContainersToFile();
  bool migrateCachedCodeSigningInfoFromBundleContainersToMapping();

 private:
  // Removes one info value from a container's metadata file (and its cache
  // entry); 1, or the result code of the step that failed.
  VSAResultCode clearInfoValue(const VSAMetadata& container, const char* key);
  std::optional<std::vector<VSAConstMetadataRef>> containers(const VSAUserIdentityRef& user,
                                                             VSAContainerClass c,
                                                             VSAErrorRef* error);

  std::shared_ptr<VSACodeSigningMapping> mapping_;
  std::shared_ptr<VSAGroupManager> groupManager_;
  std::shared_ptr<VSAContainerCache> containerCache_;
  std::shared_ptr<VSAGlobalConfiguration> configuration_;
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache_;
  std::shared_ptr<const VSADeviceProperties> deviceProperties_;
  VSAMigrationMarkers markers_;
};
