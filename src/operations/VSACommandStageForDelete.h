// The deferred deletion of containers (command type 3). When the request's
// command queue is drained, each listed container is found in the cache,
// renamed into death row (or, when that fails, removed in place) and dropped
// from the cache; a deleted bundle's code-signing records go too, unless the
// deleted container is a transient copy whose permanent container remains. It runs
// under the all-identifiers write lock unless the caller already holds it.
// The background task that empties death row comes with the deletion
// operations.
#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "base/VSACommands.h"
#include "model/VSAContainerIdentity.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSAStageForDeleteEnvironment.h"

class VSACommandStageForDelete : public VSACommand {
 public:
  using ErrorHandler = std::function<void(VSAResultCode)>;

  // commandForStageForDeleteWithContainerIdentities:useLocking:onError:
  static std::shared_ptr<VSACommandStageForDelete> commandForStageForDeleteWithContainerIdentities(
      std::shared_ptr<const VSAStageForDeleteEnvironment> environment,
      std::vector<VSAContainerIdentityRef> containerIdentities, bool useLocking,
      ErrorHandler onError);

  VSACommandStageForDelete(std::shared_ptr<const VSAStageForDeleteEnvironment> environment,
                           std::vector<VSAContainerIdentityRef> containerIdentities,
                           bool useLocking, ErrorHandler onError);

  VSACommandNumber command() const override { return VSACommands::kStageForDelete; }
  [[nodiscard]] bool fromQueue(VSACommandQueue& queue, VSAResultCode* executeWithError) override;

  const std::vector<VSAContainerIdentityRef>& containerIdentities() const { return identities_; }
  [[nodiscard]] bool useLocking() const { return useLocking_; }

 private:
  // The cached container an identity names, or null.
  [[nodiscard]] VSAMetadataRef find(const VSAContainerIdentity& identity) const;
  // Whether `container` is transient and a permanent container of its
  // identifier and class exists (logged when so).
  [[nodiscard]] bool hasPermanentTwin(const VSAMetadata& container) const;
  // Stages one container; false with `code` set when the loop must stop.
  [[nodiscard]] bool stage(const VSAContainerIdentity& identity, VSACommandQueue& queue,
                           VSAResultCode* code);

  std::shared_ptr<const VSAStageForDeleteEnvironment> environment_;
  std::vector<VSAContainerIdentityRef> identities_;
  bool useLocking_;
  ErrorHandler onError_;
};
