#include "migration/VSAContainerMigrator.h"

#include <cerrno>
#include <exception>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "base/VSAProgressLog.h"
#include "migration/VSAOldBundleLocation.h"
#include "model/VSAPerUserConfiguration.h"

namespace {
constexpr const char* kACLMigration = "ACLMigration";
constexpr const char* kBundleMigration = "BundleMigration";
constexpr const char* kSubdirectoryMigration = "SubdirectoryMigration";
constexpr int kKeptLogFiles = 3;  // the rotating log writer's count
constexpr VSAResultCode kStatusUnreadable = VSAResult::kMetadataUnreadable;

template <typename... A>
void logMigrator(int level, const char* origin, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::Startup, level, origin, format, args...);
}

bool isENOENT(const VSAErrorRef& e) {
  return e && e->domain() == kVSAPOSIXErrorDomain && e->code() == ENOENT;
}

// "NAME.log" -> "NAME.0", "NAME.log.N" -> "NAME.N" (N <= kKeptLogFiles); else nothing.
std::optional<std::string> migratedLogName(const std::string& name) {
  size_t dot = name.find(".log");
  if (dot == 0 || dot == std::string::npos) return std::nullopt;
  std::string base = name.substr(0, dot), rest = name.substr(dot + 4);
  if (rest.empty()) return base + ".0";
  if (rest.size() < 2 || rest[0] != '.' || rest.size() > 3) return std::nullopt;
  for (size_t i = 1; i < rest.size(); ++i)
    if (rest[i] < '0' || rest[i] > '9') return std::nullopt;
  long n = std::stol(rest.substr(1));
  if (n > kKeptLogFiles) return std::nullopt;
  return VSAFormat("%@.%ld", base, n);
}

VSAContainerClass bundleClassForDataClass(VSAContainerClass c) {
  using namespace VSAClass;
  return c == kDataApplication ? kBundleApplication
         : c == kDataPlugin    ? kBundlePlugin
         : c == kDataVPNPlugin ? kBundleVPNPlugin
                               : kUndefined;
}

template <typename Body>
bool guarded(const char* origin, VSAResultCode* cell, Body body) {
  try {
    return body();
  } catch (const std::exception& e) {
    logMigrator(kVSALogError, origin, "Got exception: %@ : %@", "std::exception", e.what());
    VSASetCode(cell, VSAResult::kExceptionInTransaction);
    return false;
  }
}
}  // namespace

std::unique_ptr<VSAMigrationStatus> VSAContainerMigrator::systemStatus() {
  return VSAMigrationStatus::initForSystemMigration(*dependencies_.configuration,
                                                    dependencies_.systemVersionPath);
}

bool VSAContainerMigrator::performSynchronousBuildUpgradeMigration(VSAMigrationStatus& status,
                                                                   VSAErrorRef* error) {
  migrateLogFiles(status.currentBuildVersion());
  if (!migrateOldBundleLocation(error)) return false;
  _checkIfDeviceMayNeedSystemContainerACLMigration(status);
  if (!_performWhitelistMigrationWithError(error)) {
    logMigrator(kVSALogError, "performSynchronousBuildUpgradeMigration",
                "Failed to migrate whitelisted bundle containers : %@", error ? *error : nullptr);
    return false;
  }
  return true;
}

void VSAContainerMigrator::migrateLogFiles(const std::string& build) {
  const char* origin = "performSynchronousBuildUpgradeMigration";
  auto& config = *dependencies_.configuration;
  auto& fm = config.fileManager();
  auto perUser = config.getPerUserConfigurationForUserIdentity(
      dependencies_.userIdentityCache->defaultUserIdentity());
  if (!perUser) return;
  std::string old = perUser->oldLoggingPath();
  if (fm.itemDoesNotExistAtURL(old)) return;  // nothing of an old release: silent
  VSAErrorRef error;
  auto items = fm.urlsForItemsInDirectoryAtURL(old, &error);
  if (!items) {
    if (!isENOENT(error))
      logMigrator(kVSALogError, origin, "Failed to get items for deletion: %@ : %@", old, error);
    return;
  }
  std::string logDirectory = config.logDirectory();
  for (const auto& item : *items) {
    auto name = item.isDirectory ? std::nullopt : migratedLogName(VSALastPathComponent(item.path));
    if (!name) continue;
    VSAErrorRef moveError;
    if (!fm.moveItemAtURL(item.path, VSAPathJoin(logDirectory, *name), &moveError))
      logMigrator(kVSALogError, origin, "Failed to move to new logging directory from %@ : %@",
                  item.path, moveError);
  }
  logMigrator(kVSALogNotice, origin, "Migrated log files on %@", build);
  VSAErrorRef removeError;
  if (!fm.removeItemAtURL(old, &removeError))
    logMigrator(kVSALogError, origin, "Failed to remove old Log directory: %@", removeError);
}

// Moves what the installation left in the old location into place (see
// VSAOldBundleLocation.h); anything planted there stays behind.
bool VSAContainerMigrator::migrateOldBundleLocation(VSAErrorRef* error) {
  const char* origin = "performSynchronousBuildUpgradeMigration";
  auto& fm = dependencies_.configuration->fileManager();
  const std::string& old = dependencies_.oldBundleLocation;
  if (old.empty() || !fm.itemExistsAtURL(old)) return true;
  logMigrator(kVSALogNotice, origin, "Moving bundle containers from user to system location");
  if (!VSAMoveOldBundleLocation(fm.fileSystem(), old,
                                dependencies_.configuration->bundleDirectory(), error)) {
    logMigrator(kVSALogError, origin,
                "Failed to migrate to new bundle containers location : %@.  This is terrible.",
                error ? *error : nullptr);
    return false;
  }
  return true;
}

void VSAContainerMigrator::_checkIfDeviceMayNeedSystemContainerACLMigration(
    VSAMigrationStatus& status) {
  if (status.hasMigrationOccurredForType(kACLMigration)) return;
  auto& config = *dependencies_.configuration;
  auto& fm = config.fileManager();
  for (VSAContainerClass c : {VSAClass::kSystemData, VSAClass::kSystemGroup})
    if (fm.itemExistsAtURL(config.globalContainerBaseURLWithContentClass(c, false).value_or("")))
      return;
  logMigrator(kVSALogNotice, "_checkIfDeviceMayNeedSystemContainerACLMigration",
              "No system containers requiring ACL migration");
  status.setMigrationCompleteForType(kACLMigration);
}

bool VSAContainerMigrator::_performInternalACLMigrationWithError(VSAMigrationStatus& status,
                                                                 VSAErrorRef* error) {
  if (status.hasMigrationOccurredForType(kACLMigration)) return true;
  auto& config = *dependencies_.configuration;
  auto& fm = config.fileManager();
  bool ok = true;
  for (VSAContainerClass c : {VSAClass::kSystemData, VSAClass::kSystemGroup}) {
    std::string dir = config.globalContainerBaseURLWithContentClass(c, false).value_or("");
    if (!fm.itemExistsAtURL(dir)) continue;
    if (fm.standardizeAllSystemContainerACLsAtURL(dir, error)) continue;
    logMigrator(kVSALogError, "_performInternalACLMigrationWithError",
                c == VSAClass::kSystemData ? "Failed to set ACLs on system containers : %@"
                                           : "Failed to set ACLs on system group containers : %@",
                error ? *error : nullptr);
    ok = false;
  }
  return ok && status.setMigrationCompleteForType(kACLMigration);
}

bool VSAContainerMigrator::_performBundleContainerOwnershipMigrationWithError(
    VSAMigrationStatus& status, VSAErrorRef* error) {
  if (status.hasMigrationOccurredForType(kBundleMigration)) return true;
  const char* origin = "_performBundleContainerOwnershipMigrationWithError";
  logMigrator(kVSALogNotice, origin, "Changing ownership of bundle container content.");
  std::string bundles = dependencies_.configuration->bundleDirectory();
  if (!dependencies_.configuration->fileManager().standardizeOwnershipAtURL(bundles, 33, 33,
                                                                            error)) {
    logMigrator(kVSALogError, origin, "Failed to change owner of %@: %@", bundles,
                error ? *error : nullptr);
    return false;
  }
  return status.setMigrationCompleteForType(kBundleMigration);
}

bool VSAContainerMigrator::_performWhitelistMigrationWithError(VSAErrorRef* error) {
  const char* origin = "_performWhitelistMigrationWithError";
  auto user = dependencies_.userIdentityCache->defaultUserIdentity();
  auto& cache = *dependencies_.containerCache;
  auto& fm = dependencies_.configuration->fileManager();
  bool ok = true;
  for (VSAContainerClass c : {VSAClass::kSystemData, VSAClass::kSystemGroup}) {
    auto dir = dependencies_.configuration->containerDirectoryURLForUserIdentity(user, c, false);
    auto all = cache.allContainersForUserIdentity(user, c, {}, error);
    if (!dir || !all) {
      logMigrator(kVSALogError, origin,
                  "Failed to get list of system containers for migration: (error= %@ : %lld)",
                  error ? *error : nullptr, static_cast<long long>(c));
      ok = false;
      continue;
    }
    for (const auto& m : *all) {
      auto name = dependencies_.wellknown.wellknownContainerForId(m->identifier(), c);
      if (!name) continue;
      std::string target = VSAPathJoin(*dir, *name);
      if (m->url() == target) continue;
      logMigrator(kVSALogNotice, origin, "Migrating well-known container %@ from %@ to %@",
                  m->identifier(), m->url(), target);
      VSAErrorRef stepError;
      if (!cache.removeContainerForUserIdentity(user, c, m->identifier(), false, &stepError)) {
        logMigrator(kVSALogError, origin,
                    "%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)",
                    origin, m->identifier(), stepError, 0LL);
        ok = false;
        continue;
      }
      if (!fm.moveItemAtURL(m->url(), target, &stepError)) {
        logMigrator(kVSALogError, origin,
                    "%s: Failed to move system container %@ from %@ to whitelisted location %@: "
                    "(error= %@: %lld)",
                    origin, m->identifier(), m->url(), target, stepError, 0LL);
        VSASetError(error, stepError);
        ok = false;
        continue;
      }
      VSAMetadata moved = *m;
      moved.setUrl(target);
      if (!cache.addContainerMetadata(moved, target, {.updateSandbox = true}, &stepError)) {
        logMigrator(kVSALogError, origin,
                    "%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)",
                    origin, m->identifier(), stepError, 0LL);
        ok = false;
      }
    }
  }
  return ok;
}

bool VSAContainerMigrator::performDataMigratorMigrationForClientConnection(
    const VSAMigrationClient&, VSACommandQueue& commandQueue, VSAResultCode* withError) {
  const char* origin = "performDataMigratorMigrationForClientConnection";
  return guarded(origin, withError, [&] {
    auto status = systemStatus();
    if (!status) {
      VSASetCode(withError, kStatusUnreadable);
      return false;
    }
    logMigrator(kVSALogNotice, origin, "Performing Data Migration on %@",
                status->currentBuildVersion());
    bool ok = true;
    // The error of the step that failed (the later one when both did) is
    // what the client is answered with.
    VSAErrorRef failure;
    VSAErrorRef error;
    if (!_performInternalACLMigrationWithError(*status, &error)) {
      logMigrator(kVSALogError, origin, "Failed to migrate ACLs on system containers : %@", error);
      failure = error;
      ok = false;
    }
    error = nullptr;
    if (!_performBundleContainerOwnershipMigrationWithError(*status, &error)) {
      logMigrator(kVSALogError, origin,
                  "Failed to migrate bundle containers to system location : %@", error);
      failure = error;
      ok = false;
    }
    if (!dependencies_.codeSigningMigration
             .performAllCodeSigningMigrationAndReconciliationWithCommandQueue(commandQueue,
                                                                              *status))
      ok = false;
    if (!ok)
      VSASetCode(withError,
                 failure ? failure->resultCode(VSAResult::kWriteFailed) : VSAResult::kWriteFailed);
    return ok;
  });
}

bool VSAContainerMigrator::performPerUserDataMigrationForClientConnection(
    const VSAMigrationClient& client, VSAResultCode* withError) {
  const char* origin = "performPerUserDataMigrationForClientConnection";
  return guarded(origin, withError, [&] {
    auto mobile = dependencies_.userIdentityCache->defaultUserIdentity();
    logMigrator(kVSALogNotice, origin,
                "Container data migration requested by %@ for current mobile user: %u",
                client.bundleIdentifier, mobile ? mobile->posixUID() : 0u);
    auto status = VSAMigrationStatus::initForMobileUserMigration(*dependencies_.configuration,
                                                                 *dependencies_.userIdentityCache,
                                                                 dependencies_.systemVersionPath);
    if (!status) {
      VSASetCode(withError, kStatusUnreadable);
      return false;
    }
    bool ok = true;
    if (!status->hasMigrationOccurredForType(kSubdirectoryMigration)) {
      bool all = true;
      dependencies_.userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
          [&](const VSAUserIdentityRef& user) {
            all = subdirectoryMigration(user, client, status->currentBuildVersion()) && all;
          });
      ok = all && status->setMigrationCompleteForType(kSubdirectoryMigration);
    }
    dependencies_.userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const VSAUserIdentityRef& user) {
          ok = dataProtectionMigration(user, client, status->currentBuildVersion()) && ok;
        });
    removeDeprecatedContainers(client);
    if (!ok) VSASetCode(withError, VSAResult::kWriteFailed);
    return ok;
  });
}

bool VSAContainerMigrator::subdirectoryMigration(const VSAUserIdentityRef& user,
                                                 const VSAMigrationClient& client,
                                                 const std::string& build) {
  const char* origin = "performPerUserDataMigrationForClientConnection";
  logMigrator(kVSALogNotice, origin, "Performing Per User Subdirectory Migration for %@ on %@",
              user->shortDescription(), build);
  bool ok = true;
  for (VSAContainerClass c : kVSAPerUserContainerClasses) {
    VSAErrorRef error;
    auto all = dependencies_.containerCache->allContainersForUserIdentity(user, c, {}, &error);
    if (!all) {
      logMigrator(kVSALogError, origin,
                  "Failed to fetch list of containers for userIdentity: %@, class %ld : %@",
                  user->shortDescription(), static_cast<long>(c), error);
      ok = false;
      continue;
    }
    VSAProgressLog progress(VSALogCategory::Startup, origin,
                            VSAFormat("Subdirectory migration of %@, class %ld",
                                      user->shortDescription(), static_cast<long>(c)),
                            all->size(), "containers");
    for (const auto& m : *all) {
      VSAResultCode code = VSAResult::kSuccess;
      bool done = client.recreateDefaultStructure(m->containerIdentity(), &code);
      progress.advance();
      if (done) continue;
      logMigrator(kVSALogError, origin,
                  "Failed to recreate container directory structure for %@:%ld:%@ : %llu",
                  user->shortDescription(), static_cast<long>(c), m->identifier(), code);
      ok = false;
    }
  }
  logMigrator(kVSALogNotice, origin,
              "Completed Per User Subdirectory Migration for %@ on %@ : Success: %c",
              user->shortDescription(), build, ok ? 'Y' : 'N');
  return ok;
}

bool VSAContainerMigrator::dataProtectionMigration(const VSAUserIdentityRef& user,
                                                   const VSAMigrationClient& client,
                                                   const std::string& build) {
  const char* origin = "performPerUserDataMigrationForClientConnection";
  logMigrator(kVSALogNotice, origin, "Performing User Data Protection Migration for %@ on %@",
              user->shortDescription(), build);
  bool ok = true;
  for (VSAContainerClass c :
       {VSAClass::kDataApplication, VSAClass::kDataPlugin, VSAClass::kDataVPNPlugin}) {
    VSAErrorRef error;
    auto all = dependencies_.containerCache->allContainersForUserIdentity(user, c, {}, &error);
    if (!all) {
      logMigrator(kVSALogError, origin,
                  "Failed to fetch list of data containers for userIdentity: %@, class: %ld: %@",
                  user->shortDescription(), static_cast<long>(c), error);
      ok = false;
      continue;
    }
    VSAProgressLog progress(VSALogCategory::Startup, origin,
                            VSAFormat("Data protection migration of %@, class %ld",
                                      user->shortDescription(), static_cast<long>(c)),
                            all->size(), "containers");
    for (const auto& m : *all) {
      _setDataProtectionIfNecessaryOnContainer(*m, client);
      progress.advance();
    }
  }
  logMigrator(kVSALogNotice, origin,
              "Completed User Data Protection Migration for %@ on %@ : Success: %c",
              user->shortDescription(), build, ok ? 'Y' : 'N');
  return ok;
}

VSAMetadataRef VSAContainerMigrator::_bundleContainerForDataContainer(const VSAMetadata& data,
                                                                      VSAErrorRef* error) {
  VSAContainerClass bundleClass = bundleClassForDataClass(data.containerClass());
  if (!bundleClass) {
    VSASetError(error,
                VSA_ERROR(VSAResult::kInvalidArgument, "Passed an unexpected container type: %llu",
                          static_cast<unsigned long long>(data.containerClass())));
    return nullptr;
  }
  std::string app = data.identifier();
  if (data.containerClass() == VSAClass::kDataPlugin)
    if (auto parent = dependencies_.codeSigning.parentIdentifierForChildIdentifier(app)) {
      app = *parent;
      bundleClass = VSAClass::kBundleApplication;
    }
  VSAResultCode code = VSAResult::kSuccess;
  auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(data.userIdentity(), app,
                                                                          bundleClass, &code);
  if (!identity) {
    VSASetError(error, VSA_ERROR(code, "Could not create container identity from [%@]", app));
    return nullptr;
  }
  auto bundle = dependencies_.containerCache->containerForContainerIdentity(*identity);
  if (!bundle)
    VSASetError(error, VSA_ERROR(VSAResult::kContainerNotFound,
                                 "Parent Container for: \"%@\" Not Found", app));
  return bundle;
}

void VSAContainerMigrator::_setDataProtectionIfNecessaryOnContainer(
    const VSAMetadata& container, const VSAMigrationClient& client) {
  VSAErrorRef error;
  auto bundle = _bundleContainerForDataContainer(container, &error);
  if (!bundle) {
    logMigrator(kVSALogError, "_setDataProtectionIfNecessaryOnContainer",
                "Error looking up bundle container for %@ : %@", container.identifier(), error);
    return;
  }
  int32_t wanted =
      dependencies_.dataProtection.intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
          bundle->identifier());
  if (wanted != 0 && client.setDataProtection) client.setDataProtection(container, wanted);
}

void VSAContainerMigrator::removeDeprecatedContainers(const VSAMigrationClient& client) {
  const char* origin = "performPerUserDataMigrationForClientConnection";
  std::vector<uint8_t> bytes;
  auto& fs = dependencies_.configuration->fileManager().fileSystem();
  bool read =
      !dependencies_.deprecatedContainersPath.empty() &&
      fs.readFile(dependencies_.deprecatedContainersPath, &bytes, kVSAMigrationStatusMaxSize) == 0;
  auto list = read ? VSAPlist::parse(bytes, nullptr) : std::nullopt;
  const VSAValue::Array* entries = list ? list->arrayValue() : nullptr;
  if (!entries) return;
  auto user = dependencies_.userIdentityCache->defaultUserIdentity();
  for (const VSAValue& entry : *entries) {
    const VSAValue* id = entry.get("Identifier");
    const VSAValue* cls = entry.get("ContainerClass");
    VSAContainerClass c = cls && cls->uint64Value() ? *cls->uint64Value() : VSAClass::kUndefined;
    std::string name = id && id->isString() ? *id->stringValue() : std::string("(null)");
    VSAResultCode code = VSAResult::kSuccess;
    auto identity = id && id->isString() && VSAContainerClassIsValid(c)
                        ? VSAContainerIdentity::containerIdentityWithUserIdentity(
                              user, *id->stringValue(), c, &code)
                        : nullptr;
    if (!identity) {
      logMigrator(kVSALogError, origin,
                  "Could not create container identity when trying to remove deprecated [%llu:%@]",
                  static_cast<unsigned long long>(c), name);
      continue;
    }
    if (!dependencies_.containerCache->containerForContainerIdentity(*identity))
      continue;  // gone already
    code = VSAResult::kSuccess;
    if (!client.deleteContainer(identity, &code))
      logMigrator(kVSALogError, origin, "Could not delete deprecated container [%llu:%@]: %llu",
                  static_cast<unsigned long long>(c), name, code);
  }
}
