#include "daemon/VSAClientConnection.h"

#include "base/VSALog.h"
#include "operations/VSABootKeeper.h"
#include "operations/VSAContainerContent.h"
#include "operations/VSAContainerDeletion.h"
#include "operations/VSAContainerLookup.h"
#include "operations/VSAContainerMaintenance.h"
#include "operations/VSAContentWipe.h"
#include "operations/VSAGroupContainerLookup.h"
#include "operations/VSAReplaceOperation.h"
#include "operations/VSARetryTest.h"

VSAClientConnection::VSAClientConnection(VSADaemonContext& context,
                                         VSAClientIdentityRef clientIdentity, bool entitled,
                                         bool allowOtherIdLookup, bool unrestricted,
                                         std::optional<VSAValue> lookup,
                                         std::optional<VSAValue> entitledWipeIdentifiers,
                                         std::shared_ptr<VSACommandQueue> commandQueue)
    : context_(context),
      services_(*context.operationServices),
      clientIdentity_(std::move(clientIdentity)),
      commandQueue_(std::move(commandQueue)) {
  if (clientIdentity_) {
    grants_.clientIdentifier = clientIdentity_->bundleIdentifier();
    grants_.clientUserIdentity = clientIdentity_->userIdentity();
    grants_.clientIsKernel = clientIdentity_->isKernel();
  }
  grants_.entitled = entitled;
  grants_.allowOtherIdLookup = allowOtherIdLookup;
  grants_.unrestricted = unrestricted;
  grants_.lookup = std::move(lookup);
  grants_.entitledWipeIdentifiers = std::move(entitledWipeIdentifiers);
}

std::unique_ptr<VSAClientConnection> VSAClientConnection::sharedClientConnection(
    VSADaemonContext& context) {
  return std::make_unique<VSAClientConnection>(
      context, VSAClientIdentity::anonymousPrivilegedClientIdentity(*context.userIdentityCache),
      true, true, true, std::nullopt, std::nullopt, std::make_shared<VSACommandQueue>());
}

bool VSAClientConnection::completeWithError(VSAResultCode* error) {
  return commandQueue_->executeAllUntilExhaustedOrError(error);
}

VSAMetadataRef VSAClientConnection::createOrLookupContainerWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSALookupOptions options, VSAResultCode* withError) {
  return VSAContainerLookup(services_, grants_)
      .createOrLookupContainerWithContainerIdentity(identity, options, withError);
}

std::optional<std::vector<VSAConstMetadataRef>> VSAClientConnection::containersWithClass(
    VSAContainerClass containerClass, bool transient, VSAResultCode* withError) {
  return VSAContainerLookup(services_, grants_)
      .containersWithClass(containerClass, transient, withError);
}

VSAMetadataRef VSAClientConnection::metadataWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  return VSAContainerLookup(services_, grants_).metadataWithContainerIdentity(identity, withError);
}

std::optional<uint64_t> VSAClientConnection::diskUsageWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  return VSAContainerLookup(services_, grants_).diskUsageWithContainerIdentity(identity, withError);
}

void VSAClientConnection::deleteContainerWithContainerIdentity(
    const VSAContainerIdentityRef& identity, bool transient, VSAResultCode* withError) {
  VSAContainerDeletion(services_, grants_, *commandQueue_)
      .deleteContainerWithContainerIdentity(identity, transient, withError);
}

void VSAClientConnection::deleteDataContainerContentWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  VSAContentWipe(services_, grants_)
      .deleteDataContainerContentWithContainerIdentity(identity, withError);
}

bool VSAClientConnection::replaceContainerIdentity(
    const VSAContainerIdentityRef& oldIdentity,
    const VSAContainerIdentityRef& withContainerIdentity, bool preserveOldUUID,
    bool startDeletionThread, VSAResultCode* withError) {
  return VSAReplaceOperation(services_).replaceContainerIdentity(
      oldIdentity, withContainerIdentity, preserveOldUUID, startDeletionThread, withError);
}

bool VSAClientConnection::regenerateDirectoryUUIDWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  return VSAContainerMaintenance(services_).regenerateDirectoryUUIDWithContainerIdentity(identity,
                                                                                         withError);
}

bool VSAClientConnection::recreateDefaultStructureWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  return VSAContainerMaintenance(services_).recreateDefaultStructureWithContainerIdentity(
      identity, withError);
}

std::optional<VSAValue> VSAClientConnection::infoValueForKey(
    const VSAValue* key, const VSAContainerIdentityRef& containerIdentity, bool useLocking,
    VSAResultCode* withError) {
  return VSAContainerMaintenance(services_).infoValueForKey(key, containerIdentity, useLocking,
                                                            withError);
}

bool VSAClientConnection::setInfoValue(const VSAValue* value, const VSAValue* forKey,
                                       const VSAContainerIdentityRef& containerIdentity,
                                       bool useLocking, VSAResultCode* withError) {
  return VSAContainerMaintenance(services_).setInfoValue(value, forKey, containerIdentity,
                                                         useLocking, withError);
}

std::optional<std::vector<std::pair<std::string, VSAMetadataRef>>>
VSAClientConnection::groupContainersForOwnerIdentifier(const std::string& owner,
                                                       const VSAUserIdentityRef& userIdentity,
                                                       VSAContainerClass groupContainerClass,
                                                       VSAResultCode* withError) {
  return VSAGroupContainerLookup(services_, grants_)
      .groupContainersForOwnerIdentifier(owner, userIdentity, groupContainerClass, withError);
}

std::optional<std::vector<std::string>>
VSAClientConnection::groupContainerIdentifiersForOwnerIdentifier(
    const std::string& owner, VSAContainerClass groupContainerClass, VSAResultCode* withError) {
  return VSAGroupContainerLookup(services_, grants_)
      .groupContainerIdentifiersForOwnerIdentifier(owner, groupContainerClass, withError);
}

void VSAClientConnection::rebootKeeperSetup() {
  performBuildUpgradeStepIfNeeded();
  VSABootKeeper(services_).rebootKeeperSetup(grants_);
}

void VSAClientConnection::performBuildUpgradeStepIfNeeded() {
  auto status = VSAMigrationStatus::initForSystemMigration(
      *context_.globalConfiguration,
      context_.systemRoot.resolve("/etc/vessad/system-version.plist"));
  if (!status || !status->isBuildUpgrade()) return;
  // Whether the system class directories exist is asked before the renaming
  // below lists (and so creates) them: a device that never had system
  // containers needs no ACL migration.
  context_.containerMigrator->_checkIfDeviceMayNeedSystemContainerACLMigration(*status);
  VSABootKeeper(services_)._regenerateAllSystemContainerPaths(grants_);
  VSAErrorRef error;
  if (!context_.containerMigrator->performSynchronousBuildUpgradeMigration(*status, &error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, "rebootKeeperSetup",
             "Failed to perform build upgrade migration : %@", error);
  status->writeCurrentBuildInfoToDisk();
}

VSAMigrationClient VSAClientConnection::migrationClient() {
  VSAMigrationClient client;
  client.bundleIdentifier =
      clientIdentity_ ? clientIdentity_->bundleIdentifier() : std::string("<unknown>");
  client.recreateDefaultStructure = [this](const VSAContainerIdentityRef& identity,
                                           VSAResultCode* code) {
    return recreateDefaultStructureWithContainerIdentity(identity, code);
  };
  client.deleteContainer = [this](const VSAContainerIdentityRef& identity, VSAResultCode* code) {
    deleteContainerWithContainerIdentity(identity, false, code);
    return *code == VSAResult::kSuccess;
  };
  client.setDataProtection = [protection = context_.dataProtectionManager](
                                 const VSAMetadata& container, int32_t protectionClass) {
    if (VSADataProtectionManager::currentProtectionClassOfMetadata(container) == protectionClass)
      return;
    std::string name = container.identifier();
    auto c = static_cast<unsigned long long>(container.containerClass());
    protection->setDataProtectionOnDataContainerForContainerIdentity(
        *container.containerIdentity(), protectionClass, true, true,
        [protectionClass, name, c, url = container.url()](VSAResultCode code) {
          if (code != VSAResult::kSuccess)
            VSALogIn(VSALogCategory::Startup, kVSALogError,
                     "_setDataProtectionIfNecessaryOnContainer",
                     "Error setting protection class %d on %@:%llu (%@) : %llu", protectionClass,
                     name, c, url, code);
        });
  };
  return client;
}

bool VSAClientConnection::performDataMigratorMigrationForClientConnection(
    VSAResultCode* withError) {
  return context_.containerMigrator->performDataMigratorMigrationForClientConnection(
      migrationClient(), *commandQueue_, withError);
}

bool VSAClientConnection::performPerUserDataMigrationForClientConnection(VSAResultCode* withError) {
  return context_.containerMigrator->performPerUserDataMigrationForClientConnection(
      migrationClient(), withError);
}

void VSAClientConnection::keeperSetup() { VSABootKeeper(services_).keeperSetup(); }

void VSAClientConnection::rebootKeeperCleanupWithCompletion(std::function<void()> completion) {
  VSABootKeeper(services_).rebootKeeperCleanupWithCompletion(std::move(completion));
}

void VSAClientConnection::keeperCleanupWithCompletion(std::function<void()> completion) {
  VSABootKeeper(services_).keeperCleanupWithCompletion(std::move(completion));
}

std::optional<std::string> VSAClientConnection::userManagedAssetsPathWithContainerIdentity(
    const VSAContainerIdentityRef& identity, bool isRelative, bool createIfNecessary, bool* existed,
    VSAResultCode* withError) {
  return VSAContainerContent(services_, grants_)
      .userManagedAssetsPathWithContainerIdentity(identity, isRelative, createIfNecessary, existed,
                                                  withError);
}

bool VSAClientConnection::deleteUserManagedAssetWithContainerIdentity(
    const VSAContainerIdentityRef& identity, const std::string& relativePath,
    VSAResultCode* withError) {
  return VSAContainerContent(services_, grants_)
      .deleteUserManagedAssetWithContainerIdentity(identity, relativePath, withError);
}

std::optional<std::string> VSAClientConnection::stageSharedContentForIdentifier(
    const std::string& identifier, const VSAUserIdentityRef& userIdentity,
    const std::string& sourceRelativePath, const std::string& destRelativePath,
    VSAResultCode* withError) {
  return VSAContainerContent(services_, grants_)
      .stageSharedContentForIdentifier(identifier, userIdentity, sourceRelativePath,
                                       destRelativePath, withError);
}

bool VSAClientConnection::retryTestWithNumCrashes(uint64_t numCrashes, VSAResultCode* withError) {
  return VSARetryTest(services_).retryTestWithNumCrashes(numCrashes, withError);
}
