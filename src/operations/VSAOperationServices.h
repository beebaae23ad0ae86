// The services the container operations work with: the directory layout,
// the file manager, the container cache, death row, the user identities,
// the host's per-class sub-directory list, the lock table and test locks,
// plus what they need from the modules above them (code signing, the
// whitelist, group containers, data protection), reached through the
// interfaces those modules implement so that operations stay below them.
// Built once per daemon instance (see the daemon context), which owns every
// object named here and keeps the interfaces' objects alive as long as these
// services; shared read-only by every request; each member is thread-safe.
#pragma once

#include <memory>

#include "base/VSALocks.h"
#include "base/VSATestLocks.h"
#include "model/VSACodeSigningQueries.h"
#include "model/VSAContainerCache.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"
#include "model/VSAWellknownContainers.h"
#include "operations/VSACodeSigningChanges.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSADataProtectionQueries.h"
#include "operations/VSADeathRow.h"
#include "operations/VSAGroupQueries.h"
#include "operations/VSAStageForDeleteEnvironment.h"
#include "platform/VSAContainerSubdirectories.h"
#include "platform/VSADeviceProperties.h"
#include "platform/VSAFileManager.h"
#include "platform/VSATransactions.h"

struct VSAOperationServices {
  std::shared_ptr<VSAGlobalConfiguration> configuration;
  std::shared_ptr<VSAFileManager> fileManager;
  std::shared_ptr<VSAContainerCache> containerCache;
  std::shared_ptr<VSADeathRow> deathRow;
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache;
  std::shared_ptr<VSAContainerSubdirectories> subdirectories;
  std::shared_ptr<VSADeviceProperties> deviceProperties;
  std::shared_ptr<VSATransactions> transactions;
  std::shared_ptr<VSAStageForDeleteEnvironment> stageEnvironment;
  std::shared_ptr<VSALocks> locks;
  std::shared_ptr<VSATestLocks> testLocks;

  // Whitelist: lookups allowed without a grant, well-known system containers.
  const VSAWellknownContainers& wellknown;
  // Code signing: entitlements of an identifier, the parent of a plug-in.
  VSACodeSigningQueries& codeSigning;
  // Code signing: records invalidated or removed with their containers.
  VSACodeSigningChanges& codeSigningChanges;
  // Groups: an owner's group identifiers, reconciliation of unreferenced groups.
  VSAGroupQueries& groups;
  // Data protection: the class an app asks for, the restart of interrupted changes.
  VSADataProtectionQueries& dataProtection;
};
