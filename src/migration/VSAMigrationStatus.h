// Which build the daemon last ran on and which one-time migrations have
// completed, in one property-list file: the system one
// ("vsa_migration_status.plist" in the global library directory) or the
// mobile user's ("vsa_user_migration_status.plist" in the default user's
// library directory).
//
// File content: "LastBuildInfo" (the system-version dictionary when last
// saved) and one key per completed migration type
// {"VSAMigrationVersionNumber": build, "VSAMigrationTime": date text}.
// The system-version dictionary is `<root>/etc/vessad/system-version.plist`
// ("BuildVersion", "ReleaseType"); without it the build is "Unknown"
// and every start is an upgrade. Every doubt about an upgrade answers YES.
//
// A missing status file is an empty status; one that cannot be read or is
// not a dictionary fails creation (nullptr), so that no migration runs on a
// status it cannot trust. The system status converts the marker files of
// earlier releases into its own file once, removing them only after the
// combined file was written. Saving is atomic and durable. Not thread-safe:
// one status object per migration run.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/VSAValue.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"

inline constexpr const char* kVSASystemMigrationStatusFileName = "vsa_migration_status.plist";
inline constexpr const char* kVSAUserMigrationStatusFileName = "vsa_user_migration_status.plist";
inline constexpr const char* kVSASystemVersionFileName = "system-version.plist";
inline constexpr size_t kVSAMigrationStatusMaxSize = 1u << 20;

class VSAMigrationStatus {
 public:
  // `systemVersionPath`: the system-version property list of the root.
  static std::unique_ptr<VSAMigrationStatus> initForSystemMigration(
      VSAGlobalConfiguration& configuration, const std::string& systemVersionPath);
  static std::unique_ptr<VSAMigrationStatus> initForMobileUserMigration(
      VSAGlobalConfiguration& configuration, VSAUserIdentityCache& userIdentityCache,
      const std::string& systemVersionPath);

  bool isBuildUpgrade() const;
  bool writeCurrentBuildInfoToDisk();
  bool hasMigrationOccurredForType(const std::string& type) const;
  bool setMigrationCompleteForType(const std::string& type);

  // The build version of the system-version dictionary ("Unknown" without one).
  std::string currentBuildVersion() const;
  const VSAValue& migrationInfo() const { return migrationInfo_; }
  const std::string& migrationFileURL() const { return migrationFileURL_; }

  VSAMigrationStatus(VSAGlobalConfiguration& configuration, std::string fileURL,
                     std::optional<VSAValue> systemVersion);

 private:
  // False when the file exists but cannot be used.
  bool _readMigrationStatusFromDisk();
  bool _writeMigrationStatusToDisk();
  void _migrateMarkerFiles();

  VSAGlobalConfiguration& configuration_;
  std::string migrationFileURL_;
  std::optional<VSAValue> systemVersion_;
  VSAValue migrationInfo_ = VSAValue::dictionary();
};
