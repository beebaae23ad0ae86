#include "operations/VSACommandStageForDelete.h"

#include <exception>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "model/VSAConcreteContainerIdentity.h"

namespace {
constexpr VSAResultCode kDeleteFailed = 28;
constexpr VSAResultCode kCacheRemovalFailed = 46;

}  // namespace

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

bool VSACommandStageForDelete::stage(const VSAContainerIdentity& identity, VSACommandQueue& queue,
                                     VSAResultCode* code) {
  auto& cache = *environment_->cache;
  auto& config = *environment_->configuration;
  // A concrete identity names one directory; a plain one, the live container.
  VSAMetadataRef container = identity.isConcrete() ? cache.containerForContainerIdentity(identity)
                                                   : cache.containerForContainerIdentity(
                                                         identity, false, true, false, nullptr);
  if (!container) return true;  // nothing to stage
  std::string destination =
      VSAPathJoin(config.deathrowDirectory(), VSALastPathComponent(container->url()));
  if (VSAContainerClassIsBundle(identity.containerClass()) && environment_->removeCodeSigning)
    environment_->removeCodeSigning(identity.identifier(), queue);
  VSAErrorRef error;
  if (!config.fileManager().moveItemAtURL(container->url(), destination, &error)) {
    VSALog(kVSALogDebug, "fromQueue", "Couldn't stage for deletion from %@ to %@: %@",
           container->url(), destination, error);
    if (!config.fileManager().removeItemAtURL(container->url(), &error)) {
      VSALog(kVSALogError, "fromQueue", "Failed to delete container at %@: %@", container->url(),
             error);
      *code = kDeleteFailed;
      return true;  // keep the cache entry; go on with the next container
    }
  }
  if (!cache.removeContainerForUserIdentity(container->userIdentity(), container->containerClass(),
                                            container->identifier(), false, &error)) {
    VSALog(kVSALogError, "fromQueue",
           "Failed to remove from cache id: %@, class: %ld, transient: %d", container->identifier(),
           static_cast<long>(container->containerClass()), 0);
    *code = kCacheRemovalFailed;
    return false;
  }
  return true;
}

bool VSACommandStageForDelete::fromQueue(VSACommandQueue& queue, VSAResultCode* executeWithError) {
  VSAResultCode code = VSAResult::kSuccess;
  if (!environment_ || !environment_->cache || !environment_->configuration) {
    VSALog(kVSALogFault, "fromQueue", "Stage-for-delete command made without its environment");
    if (onError_) onError_(kDeleteFailed);
    VSASetCode(executeWithError, kDeleteFailed);
    return false;
  }
  try {
    VSAAllIdentifiersLockGuard lock(true, useLocking_);
    for (const auto& identity : identities_)
      if (identity && !stage(*identity, queue, &code)) break;
  } catch (const std::exception& e) {
    VSALog(kVSALogError, "fromQueue", "Got exception: %@ : %@", "std::exception", e.what());
    code = kDeleteFailed;
  }
  if (code == VSAResult::kSuccess) return true;
  if (onError_) onError_(code);
  VSASetCode(executeWithError, code);
  return false;
}
