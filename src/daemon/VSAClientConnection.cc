#include "daemon/VSAClientConnection.h"

#include "base/VSALog.h"

VSAClientConnection::VSAClientConnection(VSADaemonContext& context,
                                         VSAClientIdentityRef clientIdentity, bool entitled,
                                         bool allowOtherIdLookup, bool unrestricted,
                                         std::optional<VSAValue> lookup,
                                         std::optional<VSAValue> entitledWipeIdentifiers,
                                         std::shared_ptr<VSACommandQueue> commandQueue)
    : context_(context),
      clientIdentity_(std::move(clientIdentity)),
      entitled_(entitled),
      allowOtherIdLookup_(allowOtherIdLookup),
      unrestricted_(unrestricted),
      lookup_(std::move(lookup)),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)),
      commandQueue_(std::move(commandQueue)) {}

std::unique_ptr<VSAClientConnection> VSAClientConnection::sharedClientConnection(
    VSADaemonContext& context) {
  return std::make_unique<VSAClientConnection>(
      context, VSAClientIdentity::anonymousPrivilegedClientIdentity(*context.userIdentityCache),
      true, true, true, std::nullopt, std::nullopt, std::make_shared<VSACommandQueue>());
}

bool VSAClientConnection::completeWithError(VSAResultCode* error) {
  return commandQueue_->executeAllUntilExhaustedOrError(error);
}

// The container steps of boot-time setup and cleanup (staging and transient
// leftovers, replace recovery, pending protection changes, death row) are
// built with the container operations; until then these say so in the log,
// and the cleanups still complete so that start-up posts its notifications.
void VSAClientConnection::rebootKeeperSetup() {
  VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
           "First-boot setup: no container setup steps are available in this build");
}

void VSAClientConnection::keeperSetup() {
  VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
           "Boot setup: replace-operation recovery is not available in this build");
  VSAErrorRef error;
  if (!context_.dataProtectionManager->restartPendingDataProtectionOperationsWithError(&error))
    VSALogIn(VSALogCategory::Startup, kVSALogError, __func__,
             "Failed restarting pending data protection operations: %@", error);
}

void VSAClientConnection::rebootKeeperCleanupWithCompletion(std::function<void()> completion) {
  VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
           "First-boot cleanup: no container cleanup steps are available in this build");
  context_.asyncWithTransaction(VSAWorkQueue::global(VSAWorkQueue::Priority::Background),
                                std::move(completion));
}

void VSAClientConnection::keeperCleanupWithCompletion(std::function<void()> completion) {
  VSALogIn(VSALogCategory::Startup, kVSALogNotice, __func__,
           "Boot cleanup: no container cleanup steps are available in this build");
  context_.asyncWithTransaction(VSAWorkQueue::global(VSAWorkQueue::Priority::Background),
                                std::move(completion));
}
