// Per-container operations of a request: deletion, listing and metadata.
#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "daemon/VSAClientConnection.h"
#include "operations/VSACommandStageForDelete.h"

void VSAClientConnection::deleteContainerWithContainerIdentity(
    const VSAContainerIdentityRef& identity, bool transient, VSAResultCode* withError) {
  VSAResultCode code = VSAResult::kSuccess;
  VSAMetadataRef found =
      createOrLookupContainerWithContainerIdentity(identity, false, transient, true, &code);
  if (!found) {
    VSALog(kVSALogError, __func__,
           "Failed to lookup existing container to delete-identity: %@, transient: %d",
           identity ? identity->description() : std::string("(null)"), transient);
    VSASetCode(withError, code);
    return;
  }
  commandQueue_->insertCommand(
      VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
          context_.stageEnvironment, {found->containerIdentity()}, true, nullptr));
}

std::optional<std::vector<VSAMetadataRef>> VSAClientConnection::containersWithClass(
    VSAContainerClass containerClass, bool transient, VSAResultCode* withError) {
  VSAUserIdentityRef user = clientIdentity_ ? clientIdentity_->userIdentity() : nullptr;
  if (!user) user = context_.userIdentityCache->defaultUserIdentity();
  VSAAllIdentifiersLockGuard lock(false);
  VSAErrorRef error;
  auto all = context_.containerCache->allContainersForUserIdentity(user, containerClass, transient,
                                                                   false, &error);
  if (!all) {
    VSALog(kVSALogError, __func__, "Failed to list containers of class %llu: %@",
           static_cast<unsigned long long>(containerClass), error);
    VSASetCode(withError, error ? error->resultCode(VSAResult::kContainerNotFound)
                                : VSAResult::kContainerNotFound);
    return std::nullopt;
  }
  // Without a grant for other identifiers a client sees only its own and
  // those its lookup entitlement lists.
  if (!allowOtherIdLookup_ && !unrestricted_) {
    std::string own = clientIdentity_ ? clientIdentity_->bundleIdentifier() : std::string();
    std::erase_if(*all, [&](const VSAMetadataRef& m) {
      return m->identifier() != own &&
             !isEntitledForLookupWithClass(containerClass, m->identifier());
    });
  }
  return all;
}

VSAMetadataRef VSAClientConnection::metadataWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  VSAMetadataRef found =
      createOrLookupContainerWithContainerIdentity(identity, false, false, true, withError);
  if (!found) return nullptr;
  // Re-read under the identifier lock so that a concurrent info change is seen whole.
  VSAIdentifierLockGuard lock(VSAValue(found->uuid().string()), false);
  VSAErrorRef error;
  auto fresh = VSAMetadata::readAndValidateMetadataAtUrl(found->url(), found->userIdentity(), false,
                                                         *context_.globalConfiguration,
                                                         *context_.userIdentityCache, &error);
  if (!fresh) {
    VSASetCode(withError, error ? error->resultCode(VSAResult::kMetadataUnreadable)
                                : VSAResult::kMetadataUnreadable);
    return nullptr;
  }
  fresh->setExisted(true);
  return fresh;
}
