// Everything one daemon instance is built from: its system root, the
// platform services of that root, the global configuration, the daemon's
// queues, its identifier lock table and test locks, and the modules of every
// layer. The daemon creates one context at start-up; tests build their own
// around a temporary root, so several daemons live in one process without
// sharing a lock, a queue or a test lock. Members are set before the first
// request and not replaced afterwards.
//
// Construction is in two steps. The first makes the platform services, the
// lock table and the queues (no log lines): the daemon needs them to listen
// before its log is open. The second, buildSubsystems(), makes the
// configuration, caches, code-signing database and managers, which log as
// they start; the daemon runs it in its initialisation routine after opening
// the log. Tests get both at once.
//
// Lower layers reach the modules above them only through interfaces
// (VSAWellknownContainers, VSACodeSigningQueries, VSACodeSigningChanges,
// VSAGroupQueries, VSADataProtectionQueries, VSACodeSigningMigrationPass),
// which the whitelist, the code-signing mapping, the group manager, the
// data-protection manager and the migration runner implement. The context
// owns those objects and declares them before everything it hands them to,
// so they are destroyed last: a reference it hands out never outlives its
// object. The wiring is in VSADaemonContext.cc.
#pragma once

#include <functional>
#include <memory>

#include "base/VSALocks.h"
#include "base/VSATestLocks.h"
#include "base/VSAWorkQueue.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "codesigning/VSAGroupManager.h"
#include "codesigning/VSAWhitelist.h"
#include "daemon/VSACodeSigningMigrationRunner.h"
#include "dataprotection/VSADataProtectionManager.h"
#include "migration/VSAContainerMigrator.h"
#include "model/VSAContainerCache.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentitySharedCache.h"
#include "operations/VSADeathRow.h"
#include "operations/VSAOperationServices.h"
#include "platform/VSAApplicationTerminationService.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAContainerSubdirectories.h"
#include "platform/VSADeviceProperties.h"
#include "platform/VSAFileManager.h"
#include "platform/VSALockStateService.h"
#include "platform/VSANotificationCenter.h"
#include "platform/VSAPersonaService.h"
#include "platform/VSASandboxService.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSATransactions.h"
#include "platform/VSAUserDatabase.h"

struct VSADaemonContext {
  // `wrapFileSystem` lets a test put a fault-injecting layer over the real file system.
  using FileSystemWrapper =
      std::function<std::shared_ptr<VSAFileSystem>(std::shared_ptr<VSAFileSystem>)>;
  explicit VSADaemonContext(const VSASystemRoot& root, const FileSystemWrapper& wrapFileSystem = {},
                            bool buildSubsystemsNow = true);
  ~VSADaemonContext();
  VSADaemonContext(const VSADaemonContext&) = delete;
  VSADaemonContext& operator=(const VSADaemonContext&) = delete;

  // The container model alone: layout, users and personas, well-known
  // names. What reads a root without serving it (the root checker) stops here.
  void buildModel();
  // Everything else: caches, code signing, groups, data protection, the
  // operations' services and the migrator.
  void buildSubsystems();

  // Runs `work` on `queue` while holding the daemon busy (a transaction),
  // for work that a reply does not wait for.
  void asyncWithTransaction(const VSAWorkQueue::Ref& queue, std::function<void()> work);

  // --- Step one: the root's platform services, locks and queues.
  VSASystemRoot systemRoot;
  std::shared_ptr<VSADeviceProperties> deviceProperties;
  std::shared_ptr<VSAClientRegistry> clientRegistry;
  std::shared_ptr<VSANotificationCenter> notifications;
  std::shared_ptr<VSALockStateService> lockState;
  std::shared_ptr<VSAUserDatabase> userDatabase;
  std::shared_ptr<VSAPersonaService> personaService;
  std::shared_ptr<VSAFileSystem> fileSystem;
  std::shared_ptr<VSAFileManager> fileManager;
  std::shared_ptr<VSATransactions> transactions;
  std::shared_ptr<VSASandboxService> sandboxService;
  std::shared_ptr<VSAContainerSubdirectories> subdirectories;
  // The identifier lock table and the test locks over it.
  std::shared_ptr<VSALocks> locks;
  std::shared_ptr<VSATestLocks> testLocks;

  VSAWorkQueue::Ref listenerQueue;    // "com.tamsk.vessad.listener"
  VSAWorkQueue::Ref deathrowQueue;    // "com.tamsk.vessad.deathrow"
  VSAWorkQueue::Ref lockStateQueue;   // "com.tamsk.vessad.lockstate", suspended while locked
  VSAWorkQueue::Ref backgroundQueue;  // "com.tamsk.vessad.background": emptying death row

  // --- Step two: the model, then the modules that implement the interfaces
  // (declared first, destroyed last), then what uses them.
  std::shared_ptr<VSAGlobalConfiguration> globalConfiguration;
  std::shared_ptr<VSAUserIdentitySharedCache> userIdentityCache;
  std::shared_ptr<VSAWhitelist> whitelist;
  std::shared_ptr<VSADeathRow> deathRow;
  std::shared_ptr<VSAApplicationTerminationService> terminationService;  // may be null
  std::shared_ptr<VSACodeSigningMapping> codeSigningMapping;
  std::shared_ptr<VSAContainerCache> containerCache;
  std::shared_ptr<VSAStageForDeleteEnvironment> stageEnvironment;
  std::shared_ptr<VSADataProtectionManager> dataProtectionManager;
  std::shared_ptr<VSAGroupManager> groupManager;  // the default group manager
  std::shared_ptr<VSACodeSigningMigrationRunner> codeSigningMigrationRunner;
  std::shared_ptr<VSAOperationServices> operationServices;
  std::shared_ptr<VSAContainerMigrator> containerMigrator;

 private:
  void buildDataProtection();
  void buildOperationServices();
  void buildContainerMigrator();
};
