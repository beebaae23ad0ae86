#include "migration/VSAMigrationStatus.h"

#include <cerrno>
#include <cstring>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "model/VSAPerUserConfiguration.h"

namespace {
constexpr const char* kLastBuildInfo = "LastBuildInfo";
constexpr const char* kBuildVersionKey = "BuildVersion";
constexpr const char* kReleaseTypeKey = "ReleaseType";
constexpr const char* kVersionNumberKey = "VSAMigrationVersionNumber";
constexpr const char* kTimeKey = "VSAMigrationTime";
constexpr size_t kSystemVersionMaxSize = 64u << 10;

const std::pair<const char*, const char*> kMarkerFiles[] = {
    {"vsa_bundle_migration_complete.plist", "BundleMigration"},
    {"vsa_acl2_migration_complete.plist", "ACLMigration"},
    {"vsa_group_id_migration_complete.plist", "GroupIdMigration"},
    {"vsa_code_signing_migration_complete.plist", "CodeSigningMigration"}};

void logStatus(int level, const char* origin, std::string_view format, auto... args) {
  VSALogIn(VSALogCategory::Startup, level, origin, format, args...);
}

// A dictionary read from `path`: nothing with `*missing` set when there is no
// file, nothing with `*error` set when it cannot be used.
std::optional<VSAValue> readDictionary(VSAFileSystem& fs, const std::string& path, size_t limit,
                                       bool* missing, std::string* error) {
  std::vector<uint8_t> bytes;
  int rc = fs.readFile(path, &bytes, limit);
  *missing = rc == ENOENT;
  if (rc != 0) {
    if (!*missing) *error = std::strerror(rc);
    return std::nullopt;
  }
  VSAErrorRef parseError;
  auto value = VSAPlist::parse(bytes, &parseError);
  if (!value || !value->isDictionary()) {
    *error = value ? "not a dictionary" : VSAFormat("%@", parseError);
    return std::nullopt;
  }
  return value;
}

std::string stringEntry(const VSAValue* dict, const char* key) {
  const VSAValue* v = dict ? dict->get(key) : nullptr;
  return v && v->isString() ? *v->stringValue() : std::string();
}

// The date's textual description, in UTC.
std::string dateText(const VSADate& date) {
  time_t seconds = static_cast<time_t>(date.secondsSince1970());
  struct tm parts {};
  gmtime_r(&seconds, &parts);
  char text[64];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &parts);
  return text;
}

std::optional<VSAValue> readSystemVersion(VSAFileSystem& fs, const std::string& path) {
  bool missing = false;
  std::string error;
  auto version = readDictionary(fs, path, kSystemVersionMaxSize, &missing, &error);
  if (!version && !missing)
    logStatus(kVSALogError, "currentBuildVersion", "Failed to read system version at %@ : %@", path,
              error);
  return version;
}
}  // namespace

VSAMigrationStatus::VSAMigrationStatus(VSAGlobalConfiguration& configuration, std::string fileURL,
                                       std::optional<VSAValue> systemVersion)
    : configuration_(configuration),
      migrationFileURL_(std::move(fileURL)),
      systemVersion_(std::move(systemVersion)) {}

std::unique_ptr<VSAMigrationStatus> VSAMigrationStatus::initForSystemMigration(
    VSAGlobalConfiguration& configuration, const std::string& systemVersionPath) {
  auto status = std::make_unique<VSAMigrationStatus>(
      configuration,
      VSAPathJoin(configuration.libraryDirectory(), kVSASystemMigrationStatusFileName),
      readSystemVersion(configuration.fileManager().fileSystem(), systemVersionPath));
  if (!status->_readMigrationStatusFromDisk()) {
    logStatus(kVSALogError, "initForSystemMigration",
              "Error reading system migration file from disk.  This is bad");
    return nullptr;
  }
  if (status->migrationInfo_.dictionaryValue()->empty()) status->_migrateMarkerFiles();
  return status;
}

std::unique_ptr<VSAMigrationStatus> VSAMigrationStatus::initForMobileUserMigration(
    VSAGlobalConfiguration& configuration, VSAUserIdentityCache& userIdentityCache,
    const std::string& systemVersionPath) {
  auto perUser =
      configuration.getPerUserConfigurationForUserIdentity(userIdentityCache.defaultUserIdentity());
  if (!perUser) {
    logStatus(kVSALogError, "initForMobileUserMigration", "No default user identity");
    return nullptr;
  }
  auto status = std::make_unique<VSAMigrationStatus>(
      configuration, VSAPathJoin(perUser->libraryDirectory(), kVSAUserMigrationStatusFileName),
      readSystemVersion(configuration.fileManager().fileSystem(), systemVersionPath));
  if (!status->_readMigrationStatusFromDisk()) {
    logStatus(kVSALogError, "initForMobileUserMigration",
              "Error reading user migration file from disk.  This is bad");
    return nullptr;
  }
  return status;
}

std::string VSAMigrationStatus::currentBuildVersion() const {
  std::string build = stringEntry(systemVersion_ ? &*systemVersion_ : nullptr, kBuildVersionKey);
  return build.empty() ? "Unknown" : build;
}

bool VSAMigrationStatus::isBuildUpgrade() const {
  const char* origin = "isBuildUpgrade";
  const VSAValue* last = migrationInfo_.get(kLastBuildInfo);
  if (!last) {
    logStatus(kVSALogNotice, origin,
              "Did not find last build info; we must be upgrading from pre-9.3.1 or this is an "
              "erase install.");
    return true;
  }
  std::string lastBuild = stringEntry(last, kBuildVersionKey);
  if (lastBuild.empty()) {
    logStatus(kVSALogNotice, origin,
              "Could not get build version from last build info dictionary; assuming this is an "
              "upgrade");
    return true;
  }
  if (!systemVersion_) {
    logStatus(kVSALogNotice, origin,
              "Could not get current build info; assuming this is an upgrade");
    return true;
  }
  std::string build = stringEntry(&*systemVersion_, kBuildVersionKey);
  if (build.empty()) {
    logStatus(kVSALogNotice, origin,
              "Could not get current build string; assuming this is an upgrade");
    return true;
  }
  std::string release = stringEntry(&*systemVersion_, kReleaseTypeKey);
  std::string lastRelease = stringEntry(last, kReleaseTypeKey);
  if (build == lastBuild) {
    logStatus(kVSALogNotice, origin,
              "Current build version (%@ / %@) equal to last version recorded (%@ / %@); "
              "skipping upgrade",
              build, release, lastBuild, lastRelease);
    return false;
  }
  logStatus(kVSALogNotice, origin, "Detected upgrade from %@ (%@) to %@ (%@)", lastBuild,
            lastRelease, build, release);
  return true;
}

bool VSAMigrationStatus::writeCurrentBuildInfoToDisk() {
  VSAValue previous = migrationInfo_;
  migrationInfo_.set(kLastBuildInfo, systemVersion_.value_or(VSAValue::dictionary()));
  if (!_writeMigrationStatusToDisk()) {
    migrationInfo_ = std::move(previous);
    return false;
  }
  logStatus(kVSALogNotice, "writeCurrentBuildInfoToDisk", "Saved last build version of %@",
            currentBuildVersion());
  return true;
}

bool VSAMigrationStatus::hasMigrationOccurredForType(const std::string& type) const {
  return migrationInfo_.get(type) != nullptr;
}

bool VSAMigrationStatus::setMigrationCompleteForType(const std::string& type) {
  VSAValue previous = migrationInfo_;
  migrationInfo_.set(type,
                     VSAValue::Dictionary{{kVersionNumberKey, VSAValue(currentBuildVersion())},
                                          {kTimeKey, VSAValue(dateText(VSADate::now()))}});
  if (!_writeMigrationStatusToDisk()) {
    migrationInfo_ = std::move(previous);
    return false;
  }
  logStatus(kVSALogNotice, "setMigrationCompleteForType", "Migration completed on %@ for %@",
            currentBuildVersion(), type);
  return true;
}

bool VSAMigrationStatus::_readMigrationStatusFromDisk() {
  bool missing = false;
  std::string error;
  auto info = readDictionary(configuration_.fileManager().fileSystem(), migrationFileURL_,
                             kVSAMigrationStatusMaxSize, &missing, &error);
  if (info) {
    migrationInfo_ = std::move(*info);
    return true;
  }
  if (missing) return true;
  logStatus(kVSALogError, "_readMigrationStatusFromDisk",
            "Failed to read migration status file at %@ : %@", migrationFileURL_, error);
  return false;
}

bool VSAMigrationStatus::_writeMigrationStatusToDisk() {
  VSAErrorRef error;
  auto bytes = VSAPlist::serialize(migrationInfo_, VSAPlist::Format::Binary, &error);
  if (bytes && configuration_.fileManager().writeFileAtomicallyAtURL(migrationFileURL_, *bytes,
                                                                     0644, std::nullopt, &error))
    return true;
  logStatus(kVSALogError, "_writeMigrationStatusToDisk",
            "Failed to write migration status on %@ for %@ : %@", currentBuildVersion(),
            migrationFileURL_, error);
  return false;
}

void VSAMigrationStatus::_migrateMarkerFiles() {
  const char* origin = "_migrateMarkerFiles";
  logStatus(kVSALogNotice, origin, "Migrating from many marker files down to one");
  auto& fm = configuration_.fileManager();
  std::string library = configuration_.libraryDirectory();
  for (const auto& [file, type] : kMarkerFiles) {
    std::string path = VSAPathJoin(library, file);
    bool missing = false;
    std::string error;
    auto marker =
        readDictionary(fm.fileSystem(), path, kVSAMigrationStatusMaxSize, &missing, &error);
    if (marker)
      migrationInfo_.set(type, std::move(*marker));
    else if (!missing)
      logStatus(kVSALogError, origin, "Failed to read migration marker file at %@ : %@", path,
                error);
  }
  if (!_writeMigrationStatusToDisk()) return;
  for (const auto& [file, type] : kMarkerFiles) {
    std::string path = VSAPathJoin(library, file);
    VSAErrorRef error;
    if (!fm.removeFileAtURL(path, &error))
      logStatus(kVSALogError, origin, "Failed to remove marker file at %@: %@", path, error);
  }
}
