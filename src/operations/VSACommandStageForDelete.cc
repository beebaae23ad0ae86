#include "operations/VSACommandStageForDelete.h"

#include <exception>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSATestLocks.h"
#include "model/VSAConcreteContainerIdentity.h"

namespace {}  // namespace

std::shared_ptr<VSACommandStageForDelete>
VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::shared_ptr<const VSAStageForDeleteEnvironment> environment,
    std::vector<VSAContainerIdentityRef> containerIdentities, bool useLocking,
    ErrorHandler onError) {
  return std::make_shared<VSACommandStageForDelete>(
      std::move(environment), std::move(containerIdentities), useLocking, std::move(onError));
}

VSACommandStageForDelete::VSACommandStageForDelete(
    std::shared_ptr<const VSAStageForDeleteEnvironment> environment,
    std::vector<VSAContainerIdentityRef> containerIdentities, bool useLocking, ErrorHandler onError)
    : environment_(std::move(environment)),
      identities_(std::move(containerIdentities)),
      useLocking_(useLocking),
      onError_(std::move(onError)) {}

VSAMetadataRef VSACommandStageForDelete::find(const VSAContainerIdentity& identity) const {
  auto& cache = *environment_->cache;
  // A plain identity names the live container of its identifier.
  if (!identity.isConcrete())
    return cache.containerForContainerIdentity(identity, {.updateSandbox = true}, nullptr);
  // A concrete identity names one directory, which may be a transient
  // container (deleting one names it by its UUID); its permanent twin of the
  // same identifier, if any, must not be taken for it.
  const VSAUUID& uuid = static_cast<const VSAConcreteContainerIdentity&>(identity).uuid();
  VSAMetadataRef live = cache.containerForContainerIdentity(identity);
  if (live && live->uuid() == uuid) return live;
  VSAMetadataRef transient =
      cache.containerForContainerIdentity(identity, {.transient = true}, nullptr);
  if (transient && transient->uuid() == uuid) return transient;
  return live;
}

bool VSACommandStageForDelete::hasPermanentTwin(const VSAMetadata& container) const {
  if (!container.transient()) return false;
  VSAResultCode code = VSAResult::kSuccess;
  auto permanentIdentity = VSAContainerIdentity::containerIdentityWithUserIdentity(
      container.userIdentity(), container.identifier(), container.containerClass(), &code);
  if (!permanentIdentity) {
    VSALog(kVSALogError, "fromQueue",
           "Could not construct container identity from %@ to check for permanent copy: %llu",
           container, static_cast<unsigned long long>(code));
    return false;
  }
  VSAErrorRef error;
  if (!environment_->cache->containerForContainerIdentity(*permanentIdentity, {}, &error))
    return false;
  VSALog(kVSALogNotice, "fromQueue",
         "Skipping removal of code sign mapping since container to be deleted [%@] is transient "
         "and there's a permanent one; error = %@",
         container, error);
  return true;
}

bool VSACommandStageForDelete::stage(const VSAContainerIdentity& identity, VSACommandQueue& queue,
                                     VSAResultCode* code) {
  auto& cache = *environment_->cache;
  auto& config = *environment_->configuration;
  VSAMetadataRef container = find(identity);
  if (!container) return true;  // nothing to stage
  std::string destination =
      VSAPathJoin(config.deathrowDirectory(), VSALastPathComponent(container->url()));
  // A transient copy of a bundle goes while its permanent container stays,
  // and the permanent one still needs the identifier's code-signing records.
  if (VSAContainerClassIsBundle(container->containerClass()) && !hasPermanentTwin(*container))
    environment_->codeSigning->removeCodeSigningDictionariesForIdentifierAndItsChildren(
        container->identifier(), &queue);
  environment_->testLocks->waitOnLock(kVSATestLockStageForDelete);
  VSAErrorRef error;
  if (!config.fileManager().moveItemAtURL(container->url(), destination, &error)) {
    VSALog(kVSALogDebug, "fromQueue", "Couldn't stage for deletion from %@ to %@: %@",
           container->url(), destination, error);
    if (!config.fileManager().removeItemAtURL(container->url(), &error)) {
      VSALog(kVSALogError, "fromQueue", "Failed to delete container at %@: %@", container->url(),
             error);
      *code = VSAResult::kDeleteFailed;
      return true;  // keep the cache entry; go on with the next container
    }
  }
  bool transient = container->transient();
  if (!cache.removeContainerForUserIdentity(container->userIdentity(), container->containerClass(),
                                            container->identifier(), transient, &error)) {
    VSALog(kVSALogError, "fromQueue",
           "Failed to remove from cache id: %@, class: %ld, transient: %d", container->identifier(),
           static_cast<long>(container->containerClass()), transient);
    *code = VSAResult::kCacheRemoveFailed;
    return false;
  }
  return true;
}

bool VSACommandStageForDelete::fromQueue(VSACommandQueue& queue, VSAResultCode* executeWithError) {
  VSAResultCode code = VSAResult::kSuccess;
  if (!environment_ || !environment_->cache || !environment_->configuration ||
      !environment_->locks || !environment_->testLocks || !environment_->codeSigning) {
    VSALog(kVSALogFault, "fromQueue", "Stage-for-delete command made without its environment");
    if (onError_) onError_(VSAResult::kDeleteFailed);
    VSASetCode(executeWithError, VSAResult::kDeleteFailed);
    return false;
  }
  try {
    VSAAllIdentifiersLockGuard lock(*environment_->locks, true, useLocking_);
    for (const auto& identity : identities_)
      if (identity && !stage(*identity, queue, &code)) break;
  } catch (const std::exception& e) {
    VSALog(kVSALogError, "fromQueue", "Got exception: %@ : %@", "std::exception", e.what());
    code = VSAResult::kDeleteFailed;
  }
  if (code == VSAResult::kSuccess) return true;
  if (onError_) onError_(code);
  VSASetCode(executeWithError, code);
  return false;
}
