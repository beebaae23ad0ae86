#include "daemon/VSACodeSigningMigrationRunner.h"

#include "codesigning/VSACodeSigningMigration.h"
#include "migration/VSAMigrationStatus.h"

VSACodeSigningMigrationRunner::VSACodeSigningMigrationRunner(
    std::shared_ptr<VSACodeSigningMapping> mapping, std::shared_ptr<VSAGroupManager> groupManager,
    std::shared_ptr<VSAContainerCache> containerCache,
    std::shared_ptr<VSAGlobalConfiguration> configuration,
    std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
    std::shared_ptr<const VSADeviceProperties> deviceProperties)
    : mapping_(std::move(mapping)),
      groupManager_(std::move(groupManager)),
      containerCache_(std::move(containerCache)),
      configuration_(std::move(configuration)),
      userIdentityCache_(std::move(userIdentityCache)),
      deviceProperties_(std::move(deviceProperties)) {}

bool VSACodeSigningMigrationRunner::performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
    VSACommandQueue& commandQueue, VSAMigrationStatus& status) {
  VSAMigrationMarkers markers{
      [&status](const std::string& t) { return status.hasMigrationOccurredForType(t); },
      [&status](const std::string& t) { return status.setMigrationCompleteForType(t); }};
  return VSACodeSigningMigration(mapping_, groupManager_, containerCache_, configuration_,
                                 userIdentityCache_, deviceProperties_, std::move(markers))
      .performAllCodeSigningMigrationAndReconciliationWithCommandQueue(commandQueue);
}
