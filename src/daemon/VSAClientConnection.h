// One request's view of its client: the identity and the grants the
// dispatcher derived for the command, the request's command queue, and the
// container operations that handlers call. The operations themselves live in
// operations/, one class per family; the members here forward to them with
// this request's grants, so a handler (and a reader grepping for an
// operation's name) starts here. Lives for one request (or one boot-time
// run) on the listener queue; not shared between threads.
//
// Grants: see VSAOperationGrants.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "daemon/VSAClientIdentity.h"
#include "daemon/VSADaemonContext.h"
#include "model/VSAConcreteContainerIdentity.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAMetadata.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSAContainerLookup.h"
#include "operations/VSAOperationGrants.h"
#include "platform/VSAIPCMessage.h"

class VSAClientConnection {
 public:
  // initWithClientIdentity:entitled:allowOtherIdLookup:unrestricted:lookup:
  // entitledWipeIdentifiers:commandQueue:
  VSAClientConnection(VSADaemonContext& context, VSAClientIdentityRef clientIdentity, bool entitled,
                      bool allowOtherIdLookup, bool unrestricted, std::optional<VSAValue> lookup,
                      std::optional<VSAValue> entitledWipeIdentifiers,
                      std::shared_ptr<VSACommandQueue> commandQueue);

  // The daemon's own connection, used for boot-time work.
  static std::unique_ptr<VSAClientConnection> sharedClientConnection(VSADaemonContext& context);

  VSADaemonContext& context() const { return context_; }
  const VSAClientIdentityRef& clientIdentity() const { return clientIdentity_; }
  const VSAOperationGrants& grants() const { return grants_; }
  bool entitled() const { return grants_.entitled; }
  bool allowOtherIdLookup() const { return grants_.allowOtherIdLookup; }
  bool allowGroupIdLookup() const { return grants_.allowGroupIdLookup; }
  bool unrestricted() const { return grants_.unrestricted; }
  const std::optional<VSAValue>& lookup() const { return grants_.lookup; }
  const std::optional<VSAValue>& entitledWipeIdentifiers() const {
    return grants_.entitledWipeIdentifiers;
  }
  const std::shared_ptr<VSACommandQueue>& commandQueue() const { return commandQueue_; }
  void setUnrestricted(bool v) { grants_.unrestricted = v; }
  void setAllowOtherIdLookup(bool v) { grants_.allowOtherIdLookup = v; }
  void setAllowGroupIdLookup(bool v) { grants_.allowGroupIdLookup = v; }

  // The IPC message being served; handlers that reply later keep it.
  void setRelayMessage(VSAIPCMessageRef message) { relayMessage_ = std::move(message); }
  const VSAIPCMessageRef& relayMessage() const { return relayMessage_; }

  // Create and look up (VSAContainerLookup).
  VSAMetadataRef createOrLookupContainerWithContainerIdentity(
      const VSAContainerIdentityRef& identity, VSALookupOptions options, VSAResultCode* withError);
  bool isEntitledForLookupWithClass(VSAContainerClass containerClass,
                                    const std::string& identifier) const {
    return grants_.isEntitledForLookupWithClass(containerClass, identifier);
  }
  std::optional<std::set<std::string>> _lookupForContainerClass(
      VSAContainerClass containerClass) const {
    return grants_.lookupForContainerClass(containerClass);
  }
  std::optional<std::vector<VSAConstMetadataRef>> containersWithClass(
      VSAContainerClass containerClass, bool transient, VSAResultCode* withError);
  VSAMetadataRef metadataWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                               VSAResultCode* withError);
  std::optional<uint64_t> diskUsageWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                                         VSAResultCode* withError);

  // Deletion (VSAContainerDeletion): queues the staging for request completion.
  void deleteContainerWithContainerIdentity(const VSAContainerIdentityRef& identity, bool transient,
                                            VSAResultCode* withError);
  // Content wipe (VSAContentWipe).
  void deleteDataContainerContentWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                                       VSAResultCode* withError);
  // Replace (VSAReplaceOperation).
  bool replaceContainerIdentity(const VSAContainerIdentityRef& oldIdentity,
                                const VSAContainerIdentityRef& withContainerIdentity,
                                bool preserveOldUUID, bool startDeletionThread,
                                VSAResultCode* withError);
  // Maintenance (VSAContainerMaintenance).
  bool regenerateDirectoryUUIDWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                                    VSAResultCode* withError);
  bool recreateDefaultStructureWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                                     VSAResultCode* withError);
  std::optional<VSAValue> infoValueForKey(const VSAValue* key,
                                          const VSAContainerIdentityRef& containerIdentity,
                                          bool useLocking, VSAResultCode* withError);
  bool setInfoValue(const VSAValue* value, const VSAValue* forKey,
                    const VSAContainerIdentityRef& containerIdentity, bool useLocking,
                    VSAResultCode* withError);

  // Groups of an owner (VSAGroupContainerLookup).
  std::optional<std::vector<std::pair<std::string, VSAMetadataRef>>>
  groupContainersForOwnerIdentifier(const std::string& owner,
                                    const VSAUserIdentityRef& userIdentity,
                                    VSAContainerClass groupContainerClass,
                                    VSAResultCode* withError);
  std::optional<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
      const std::string& owner, VSAContainerClass groupContainerClass, VSAResultCode* withError);

  // Content named by client paths (VSAContainerContent).
  std::optional<std::string> userManagedAssetsPathWithContainerIdentity(
      const VSAContainerIdentityRef& identity, bool isRelative, bool createIfNecessary,
      bool* existed, VSAResultCode* withError);
  bool deleteUserManagedAssetWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                                   const std::string& relativePath,
                                                   VSAResultCode* withError);
  std::optional<std::string> stageSharedContentForIdentifier(const std::string& identifier,
                                                             const VSAUserIdentityRef& userIdentity,
                                                             const std::string& sourceRelativePath,
                                                             const std::string& destRelativePath,
                                                             VSAResultCode* withError);
  // Migrations (VSAContainerMigrator), on behalf of this client.
  bool performDataMigratorMigrationForClientConnection(VSAResultCode* withError);
  bool performPerUserDataMigrationForClientConnection(VSAResultCode* withError);

  // The crash-retry test (VSARetryTest); may end the process on purpose.
  bool retryTestWithNumCrashes(uint64_t numCrashes, VSAResultCode* withError);

  // Runs the request's deferred commands; a failing command's code lands in `error`.
  bool completeWithError(VSAResultCode* error);

  // Boot-time work (VSABootKeeper).
  void rebootKeeperSetup();
  void keeperSetup();
  void rebootKeeperCleanupWithCompletion(std::function<void()> completion);
  void keeperCleanupWithCompletion(std::function<void()> completion);

 private:
  VSADaemonContext& context_;
  const VSAOperationServices& services_;
  VSAClientIdentityRef clientIdentity_;
  VSAOperationGrants grants_;
  std::shared_ptr<VSACommandQueue> commandQueue_;
  VSAIPCMessageRef relayMessage_;

  VSAMigrationClient migrationClient();
  // The first step of reboot setup: after a build upgrade, new directory
  // names for system containers, the build-upgrade migration, and the
  // build recorded whether or not the migration succeeded.
  void performBuildUpgradeStepIfNeeded();
};
