// How one daemon instance is wired: which object implements each interface
// that a lower layer declares, and the order in which they are made.
#include "daemon/VSADaemonContext.h"

#include "platform/VSALinuxFileSystem.h"
#include "platform/VSALinuxPersonaService.h"

namespace {
std::shared_ptr<VSAFileSystem> wrap(const VSADaemonContext::FileSystemWrapper& wrapper,
                                    std::shared_ptr<VSAFileSystem> fs) {
  return wrapper ? wrapper(std::move(fs)) : fs;
}

// A device may come without a termination service ("HasTerminationService" NO).
bool hasTerminationService(const VSADeviceProperties& properties) {
  const VSAValue* value = properties.deviceDictionary().get("HasTerminationService");
  return value == nullptr || value->boolValue().value_or(true);
}
}  // namespace

VSADaemonContext::VSADaemonContext(const VSASystemRoot& root,
                                   const FileSystemWrapper& wrapFileSystem, bool buildSubsystemsNow)
    : systemRoot(root),
      deviceProperties(std::make_shared<VSADeviceProperties>(root)),
      clientRegistry(std::make_shared<VSAClientRegistry>(root)),
      notifications(std::make_shared<VSANotificationCenter>(root)),
      lockState(std::make_shared<VSALockStateService>(root)),
      userDatabase(std::make_shared<VSAUserDatabase>(root)),
      personaService(std::make_shared<VSALinuxPersonaService>(root)),
      fileSystem(wrap(wrapFileSystem, std::make_shared<VSALinuxFileSystem>([lockState = lockState] {
                        return lockState->currentLockState() == 1;
                      }))),
      fileManager(std::make_shared<VSAFileManager>(fileSystem, userDatabase)),
      transactions(std::make_shared<VSATransactions>()),
      sandboxService(std::make_shared<VSASandboxService>(root)),
      subdirectories(std::make_shared<VSAContainerSubdirectories>(root)),
      locks(std::make_shared<VSALocks>()),
      testLocks(std::make_shared<VSATestLocks>(locks)),
      lockStateQueue(VSAWorkQueue::create("com.tamsk.vessad.lockstate")),
      backgroundQueue(
          VSAWorkQueue::create("com.tamsk.vessad.background", VSAWorkQueue::Kind::Serial,
                               VSAWorkQueue::global(VSAWorkQueue::Priority::Background))) {
  if (buildSubsystemsNow) buildSubsystems();
}

VSADaemonContext::~VSADaemonContext() {
  // Emptying death row may still run: it uses the configuration and file
  // manager that go with this context.
  if (backgroundQueue) backgroundQueue->sync([] {});
}

void VSADaemonContext::buildModel() {
  const VSASystemRoot& root = systemRoot;
  globalConfiguration =
      std::make_shared<VSAGlobalConfiguration>(root, deviceProperties, userDatabase, fileManager);
  whitelist = VSAWhitelist::load(root.resolve("/etc/vessad/whitelist.plist"),
                                 globalConfiguration->isInternalImage());
  userIdentityCache = VSAUserIdentitySharedCache::create(
      {personaService, userDatabase, globalConfiguration->currentMobileUserId(),
       globalConfiguration->currentMobileGroupId(),
       VSAUserIdentityCache::personasAreSupported(*deviceProperties), transactions});
}

void VSADaemonContext::buildSubsystems() {
  buildModel();
  deathRow = std::make_shared<VSADeathRow>(globalConfiguration, transactions, backgroundQueue);
  if (hasTerminationService(*deviceProperties))
    terminationService =
        std::make_shared<VSAApplicationTerminationService>(systemRoot, clientRegistry, fileSystem);
  // Opening the database stops the process when another daemon holds it.
  codeSigningMapping = std::make_shared<VSACodeSigningMapping>(
      userIdentityCache, globalConfiguration,
      std::make_unique<VSASQLiteDB>(globalConfiguration->libraryDirectory()), locks);
  containerCache = VSAContainerCache::create({userIdentityCache, globalConfiguration,
                                              sandboxService, notifications, testLocks,
                                              codeSigningMapping.get(), whitelist.get()});
  // The mapping stages deletions (group containers it releases) through the
  // cache, and a staged bundle takes its code-signing records along.
  stageEnvironment = std::make_shared<VSAStageForDeleteEnvironment>(VSAStageForDeleteEnvironment{
      containerCache, globalConfiguration, locks, testLocks, codeSigningMapping.get()});
  codeSigningMapping->setStageForDeleteEnvironment(stageEnvironment);
  buildDataProtection();
  groupManager = std::make_shared<VSAGroupManager>(
      userIdentityCache, codeSigningMapping, containerCache, globalConfiguration, stageEnvironment);
  buildOperationServices();
  buildContainerMigrator();
}

void VSADaemonContext::buildDataProtection() {
  auto protection = std::make_shared<VSADataProtectionEnvironment>();
  protection->configuration = globalConfiguration;
  protection->userIdentityCache = userIdentityCache;
  protection->containerCache = containerCache;
  protection->transactions = transactions;
  protection->lockStateQueue = lockStateQueue;
  protection->terminationService = terminationService;
  protection->locks = locks;
  protection->testLocks = testLocks;
  protection->codeSigning = codeSigningMapping.get();
  dataProtectionManager = std::make_shared<VSADataProtectionManager>(protection);
}

void VSADaemonContext::buildOperationServices() {
  operationServices = std::make_shared<VSAOperationServices>(VSAOperationServices{
      globalConfiguration, fileManager, containerCache, deathRow, userIdentityCache, subdirectories,
      deviceProperties, transactions, stageEnvironment, locks, testLocks, *whitelist,
      *codeSigningMapping, *codeSigningMapping, *groupManager, *dataProtectionManager});
}

void VSADaemonContext::buildContainerMigrator() {
  codeSigningMigrationRunner = std::make_shared<VSACodeSigningMigrationRunner>(
      codeSigningMapping, groupManager, containerCache, globalConfiguration, userIdentityCache,
      deviceProperties);
  containerMigrator = std::make_shared<VSAContainerMigrator>(VSAMigratorDependencies{
      globalConfiguration, userIdentityCache, containerCache,
      systemRoot.resolve("/etc/vessad/system-version.plist"),
      systemRoot.resolve("/private/var/mobile/Containers/Bundle"),
      systemRoot.resolve("/etc/vessad/deprecated-containers.plist"), *whitelist,
      *codeSigningMapping, *dataProtectionManager, *codeSigningMigrationRunner});
}

void VSADaemonContext::asyncWithTransaction(const VSAWorkQueue::Ref& queue,
                                            std::function<void()> work) {
  auto token = transactions->open();
  queue->async([token, work = std::move(work)] { work(); });
}
