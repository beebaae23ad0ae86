#include "operations/VSACommandStageForDelete.h"

#include "base/VSALog.h"

std::shared_ptr<VSACommandStageForDelete>
VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::vector<VSAContainerIdentityRef> containerIdentities, bool useLocking,
    ErrorHandler onError) {
  return std::make_shared<VSACommandStageForDelete>(std::move(containerIdentities), useLocking,
                                                    std::move(onError));
}

VSACommandStageForDelete::VSACommandStageForDelete(
    std::vector<VSAContainerIdentityRef> containerIdentities, bool useLocking, ErrorHandler onError)
    : identities_(std::move(containerIdentities)),
      useLocking_(useLocking),
      onError_(std::move(onError)) {}

bool VSACommandStageForDelete::fromQueue(VSACommandQueue&, VSAResultCode* executeWithError) {
  constexpr VSAResultCode kDeleteFailed = 28;
  for (const auto& identity : identities_)
    VSALog(
        kVSALogError, "fromQueue",
        "Cannot stage %@ for deletion: staging needs the container cache, which is not built yet",
        identity);
  if (onError_) onError_(kDeleteFailed);
  VSASetCode(executeWithError, kDeleteFailed);
  return false;
}
