// Group containers: which groups an owner identifier is entitled to, and
// the removal of group containers that no identifier references any more.
//
// A group is referenced once for every code-signing entry (invalid,
// placeholder and advance-copy entries included) whose entitlements name
// it; the counts are rebuilt from the database for every decision and never
// kept. Application groups (type 0, class 7) exist per user; system groups
// (type 1, class 13) under the default user identity, and only
// reconciliation removes them. Removal is never done inline: a
// stage-for-delete command is put on the caller's command queue, so the
// container goes to death row when the request (or boot step) completes.
//
// One instance per daemon (the context's `groupManager`, its default
// manager). Thread-safe: counting runs on the code-signing mapping's queue.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "model/VSAContainerCache.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSAGroupQueries.h"
#include "operations/VSAStageForDeleteEnvironment.h"

class VSAGroupManager : public VSAGroupQueries {
 public:
  // initWithUserIdentityCache:
  VSAGroupManager(std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
                  std::shared_ptr<VSACodeSigningMapping> mapping,
                  std::shared_ptr<VSAContainerCache> containerCache,
                  std::shared_ptr<VSAGlobalConfiguration> configuration,
                  std::shared_ptr<const VSAStageForDeleteEnvironment> stageEnvironment);

  const std::shared_ptr<VSAUserIdentityCache>& userIdentityCache() const {
    return userIdentityCache_;
  }

  // The group identifiers `owner` is entitled to: system groups
  // ("systemgroup." prefix) for class 13, application groups otherwise. An
  // owner without entitlements has none (an empty list). With `useLocking`
  // the all-identifiers lock is held for writing meanwhile.
  std::optional<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
      const VSAValue* owner, VSAContainerClass groupContainerClass, bool useLocking,
      VSAResultCode* withError) override;
  // Queues the deletion of every group container of `groupType` (0 or 1)
  // that no identifier references, for every user that has a base directory
  // (type 0) or the default user (type 1).
  void reconcileGroupContainersOfType(int groupType, VSACommandQueue& commandQueue) override;
  void _cleanupUnreferencedGroupContainersForUserIdentity(const VSAUserIdentityRef& user,
                                                          VSAContainerClass containerClass,
                                                          const VSAReferenceCounts& referenceCounts,
                                                          VSACommandQueue& commandQueue);

 private:
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache_;
  std::shared_ptr<VSACodeSigningMapping> mapping_;
  std::shared_ptr<VSAContainerCache> containerCache_;
  std::shared_ptr<VSAGlobalConfiguration> configuration_;
  std::shared_ptr<const VSAStageForDeleteEnvironment> stageEnvironment_;
};
