// One-time migrations after an operating-system update or on a client's
// request, each recorded in a migration status file under a type name and
// never run again once recorded:
//  - build upgrade (at start, when the build changed): old log files into
//    the log directory, the containers the installation left in the old
//    bundle location into the global bundle directory (VSAOldBundleLocation),
//    whether the ACL migration is needed, and well-known system containers
//    moved to their directory names;
//  - client-requested data migration (command 24): system-container ACLs
//    ("ACLMigration"), bundle ownership ("BundleMigration"), then the legacy
//    code-signing migrations and reconciliation;
//  - per-user data migration (command 30): default sub-directories of every
//    data container once ("SubdirectoryMigration"), then on every request
//    the data-protection class of every data container and the removal of
//    deprecated containers listed in `<root>/etc/vessad/deprecated-containers.plist`
//    (an array of {"Identifier": string, "ContainerClass": number}).
//
// Old log files: a file "NAME.log" becomes "NAME.0" and "NAME.log.N" becomes
// "NAME.N" in the log directory, for N up to the rotating writer's 3 kept
// files; anything else goes with the old directory.
//
// Every step is safe to run again after an interruption: moves are renames
// that a re-run continues, and a type is recorded only after its step
// completed. What the migrator needs from code signing, the whitelist and
// data protection comes in through their interfaces (see
// VSAMigratorDependencies), so that it stays below those modules; what it
// does on behalf of a client comes with the request (VSAMigrationClient).
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/VSAError.h"
#include "migration/VSACodeSigningMigrationPass.h"
#include "migration/VSAMigrationStatus.h"
#include "model/VSACodeSigningQueries.h"
#include "model/VSAContainerCache.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAWellknownContainers.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSADataProtectionQueries.h"

inline constexpr const char* kVSADeprecatedContainersFileName = "deprecated-containers.plist";

// Whoever fills this keeps the objects the references name alive as long as
// the migrator (the daemon context owns them all).
struct VSAMigratorDependencies {
  std::shared_ptr<VSAGlobalConfiguration> configuration;
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache;
  std::shared_ptr<VSAContainerCache> containerCache;
  std::string systemVersionPath;
  std::string oldBundleLocation;         // the root's "/private/var/mobile/Containers/Bundle"
  std::string deprecatedContainersPath;  // the root's etc/vessad/deprecated-containers.plist
  // Whitelist: the directory names of well-known system (group) containers.
  const VSAWellknownContainers& wellknown;
  // The parent app of a plug-in, when known.
  VSACodeSigningQueries& codeSigning;
  // The protection class an app's entitlements ask for (0: none).
  VSADataProtectionQueries& dataProtection;
  // The legacy code-signing migrations and reconciliation.
  VSACodeSigningMigrationPass& codeSigningMigration;
};

// What a per-user migration does on behalf of its client.
struct VSAMigrationClient {
  std::string bundleIdentifier;
  std::function<bool(const VSAContainerIdentityRef&, VSAResultCode*)> recreateDefaultStructure;
  std::function<bool(const VSAContainerIdentityRef&, VSAResultCode*)> deleteContainer;
  // Starts a protection change of a data container; failures are logged by the change.
  std::function<void(const VSAMetadata& container, int32_t protectionClass)> setDataProtection;
};

class VSAContainerMigrator {
 public:
  explicit VSAContainerMigrator(VSAMigratorDependencies dependencies)
      : dependencies_(std::move(dependencies)) {}

  bool performSynchronousBuildUpgradeMigration(VSAMigrationStatus& status, VSAErrorRef* error);
  bool performDataMigratorMigrationForClientConnection(const VSAMigrationClient& client,
                                                       VSACommandQueue& commandQueue,
                                                       VSAResultCode* withError);
  bool performPerUserDataMigrationForClientConnection(const VSAMigrationClient& client,
                                                      VSAResultCode* withError);

  void _checkIfDeviceMayNeedSystemContainerACLMigration(VSAMigrationStatus& status);
  bool _performInternalACLMigrationWithError(VSAMigrationStatus& status, VSAErrorRef* error);
  bool _performWhitelistMigrationWithError(VSAErrorRef* error);
  bool _performBundleContainerOwnershipMigrationWithError(VSAMigrationStatus& status,
                                                          VSAErrorRef* error);
  VSAMetadataRef _bundleContainerForDataContainer(const VSAMetadata& data, VSAErrorRef* error);

 private:
  void migrateLogFiles(const std::string& build);
  bool migrateOldBundleLocation(VSAErrorRef* error);
  void _setDataProtectionIfNecessaryOnContainer(const VSAMetadata& container,
                                                const VSAMigrationClient& client);
  // `build`: the current build, for the log lines.
  bool subdirectoryMigration(const VSAUserIdentityRef& user, const VSAMigrationClient& client,
                             const std::string& build);
  bool dataProtectionMigration(const VSAUserIdentityRef& user, const VSAMigrationClient& client,
                               const std::string& build);
  void removeDeprecatedContainers(const VSAMigrationClient& client);
  std::unique_ptr<VSAMigrationStatus> systemStatus();

  VSAMigratorDependencies dependencies_;
};
