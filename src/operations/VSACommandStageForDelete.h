// The deferred deletion of containers (command type 3): the containers are
// renamed into death row and dropped from the container cache when the
// request's command queue is drained, under the all-identifiers write lock
// unless the caller already holds it.
//
// Staging needs the container cache, which is not built yet: until it is,
// running the command fails with code 28 and says so, so a request that
// decided on a deletion reports that it could not be carried out.
#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "model/VSAContainerIdentity.h"
#include "operations/VSACommandQueue.h"

class VSACommandStageForDelete : public VSACommand {
 public:
  using ErrorHandler = std::function<void(VSAResultCode)>;

  // commandForStageForDeleteWithContainerIdentities:useLocking:onError:
  static std::shared_ptr<VSACommandStageForDelete> commandForStageForDeleteWithContainerIdentities(
      std::vector<VSAContainerIdentityRef> containerIdentities, bool useLocking,
      ErrorHandler onError);

  VSACommandStageForDelete(std::vector<VSAContainerIdentityRef> containerIdentities,
                           bool useLocking, ErrorHandler onError);

  uint64_t command() const override { return 3; }
  bool fromQueue(VSACommandQueue& queue, VSAResultCode* executeWithError) override;

  const std::vector<VSAContainerIdentityRef>& containerIdentities() const { return identities_; }
  bool useLocking() const { return useLocking_; }

 private:
  std::vector<VSAContainerIdentityRef> identities_;
  bool useLocking_;
  ErrorHandler onError_;
};
