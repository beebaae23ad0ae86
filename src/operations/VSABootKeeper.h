// Bringing the disk into order when the daemon starts. The two setups run
// synchronously on the listener queue before the first request; the two
// cleanups queue their slow part on the background queue and call their
// completion when done (possibly later, on another queue), holding a
// transaction that keeps the daemon alive until then. The first-boot pair
// runs only at the first start after a device boot.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

class VSAProgressLog;

// The system group whose container keeps its directory across upgrades,
// like the well-known ones: analytics collected before the upgrade stay
// where their readers look for them.
inline constexpr const char* kVSAAnalyticsSystemGroupIdentifier =
    "systemgroup.com.tamsk.osanalytics";

class VSABootKeeper {
 public:
  explicit VSABootKeeper(const VSAOperationServices& services) : services_(services) {}

  // Reinstalls backed-up system containers, then reconciles application
  // groups when the device runs in multi-user mode. (The build-upgrade step
  // before it needs the migrator and is run by the client connection.)
  void rebootKeeperSetup(const VSAOperationGrants& grants);
  void keeperSetup();
  void rebootKeeperCleanupWithCompletion(std::function<void()> completion);
  void keeperCleanupWithCompletion(std::function<void()> completion);
  // After a build upgrade: a new directory UUID for every system (group)
  // container that is not well known (their names are fixed) and not the
  // analytics system group (kVSAAnalyticsSystemGroupIdentifier).
  void _regenerateAllSystemContainerPaths(const VSAOperationGrants& grants);
  // Sends every entry that is not a live container of `containerClass` (a
  // name that is not valid for the class, or no metadata file) to death row.
  // An entry is judged without a lock first; one that looks orphaned is
  // judged again and moved under the all-identifiers lock (for reading), so
  // that a container operation in progress is never taken for an orphan.
  // The caller holds no identifier lock. `progress` (may be null) advances
  // by one per entry.
  void _cleanupOrphanedDataForDirectories(const std::vector<std::string>& entries,
                                          VSAContainerClass containerClass,
                                          VSAProgressLog* progress = nullptr);
  void _cleanupOprhanedCodeSigningMappingData();

 private:
  // Whether `url` is there and is no live container of the class; `valid`
  // tells whether its name is valid for the class.
  [[nodiscard]] bool _isOrphanedEntry(const std::string& url, VSAContainerClass c, bool* valid);

  const VSAOperationServices& services_;
};
