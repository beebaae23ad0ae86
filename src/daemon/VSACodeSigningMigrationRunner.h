// Runs the legacy code-signing migrations for the container migrator: a
// VSACodeSigningMigration over the daemon's code-signing mapping, group
// manager and caches, with its markers recorded in the migration status the
// migrator passes. Owned by the daemon context.
#pragma once

#include <memory>

#include "codesigning/VSACodeSigningMapping.h"
#include "codesigning/VSAGroupManager.h"
#include "migration/VSACodeSigningMigrationPass.h"
#include "model/VSAContainerCache.h"
#include "platform/VSADeviceProperties.h"

class VSACodeSigningMigrationRunner : public VSACodeSigningMigrationPass {
 public:
  VSACodeSigningMigrationRunner(std::shared_ptr<VSACodeSigningMapping> mapping,
                                std::shared_ptr<VSAGroupManager> groupManager,
                                std::shared_ptr<VSAContainerCache> containerCache,
                                std::shared_ptr<VSAGlobalConfiguration> configuration,
                                std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
                                std::shared_ptr<const VSADeviceProperties> deviceProperties);

  bool performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
      VSACommandQueue& commandQueue, VSAMigrationStatus& status) override;

 private:
  std::shared_ptr<VSACodeSigningMapping> mapping_;
  std::shared_ptr<VSAGroupManager> groupManager_;
  std::shared_ptr<VSAContainerCache> containerCache_;
  std::shared_ptr<VSAGlobalConfiguration> configuration_;
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache_;
  std::shared_ptr<const VSADeviceProperties> deviceProperties_;
};
