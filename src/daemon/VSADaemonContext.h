// Everything one daemon instance is built from: its system root, the
// platform services of that root, the global configuration and the daemon's
// queues. The daemon creates one context at start-up; tests build their own
// around a temporary root, so several daemons can live in one process.
// Members are set before the first request and not replaced afterwards.
//
// Construction is in two steps. The first makes the platform services (no
// log lines): the daemon needs them to listen before its log is open. The
// second, buildSubsystems(), makes the configuration, caches, code-signing
// database and managers, which log as they start; the daemon runs it in its
// initialisation routine after opening the log. Tests get both at once.
#pragma once

#include <memory>

#include "base/VSAWorkQueue.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "codesigning/VSACodeSigningMigration.h"
#include "codesigning/VSAGroupManager.h"
#include "codesigning/VSAWhitelist.h"
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
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSALinuxPersonaService.h"
#include "platform/VSALockStateService.h"
#include "platform/VSANotificationCenter.h"
#include "platform/VSASandboxService.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSATransactions.h"
#include "platform/VSAUserDatabase.h"

struct VSADaemonContext {
  // `wrapFileSystem` lets a test put a fault-injecting layer over the real file system.
  using FileSystemWrapper =
      std::function<std::shared_ptr<VSAFileSystem>(std::shared_ptr<VSAFileSystem>)>;
  explicit VSADaemonContext(const VSASystemRoot& root, const FileSystemWrapper& wrapFileSystem = {},
                            bool buildSubsystemsNow = true)
      : systemRoot(root),
        deviceProperties(std::make_shared<VSADeviceProperties>(root)),
        clientRegistry(std::make_shared<VSAClientRegistry>(root)),
        notifications(std::make_shared<VSANotificationCenter>(root)),
        lockState(std::make_shared<VSALockStateService>(root)),
        userDatabase(std::make_shared<VSAUserDatabase>(root)),
        personaService(std::make_shared<VSALinuxPersonaService>(root)),
        fileSystem(
            wrap(wrapFileSystem, std::make_shared<VSALinuxFileSystem>([lockState = lockState] {
                   return lockState->currentLockState() == 1;
                 }))),
        fileManager(std::make_shared<VSAFileManager>(fileSystem, userDatabase)),
        transactions(std::make_shared<VSATransactions>()),
        sandboxService(std::make_shared<VSASandboxService>(root)),
        subdirectories(std::make_shared<VSAContainerSubdirectories>(root)),
        lockStateQueue(VSAWorkQueue::create("com.tamsk.vessad.lockstate")) {
    if (buildSubsystemsNow) buildSubsystems();
  }

  // The container model alone: layout, users and personas, well-known
  // names. What reads a root without serving it (the root checker) stops here.
  void buildModel() {
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

  void buildSubsystems() {
    const VSASystemRoot& root = systemRoot;
    buildModel();
    deathRow = std::make_shared<VSADeathRow>(globalConfiguration, transactions);
    // A device may come without a termination service ("HasTerminationService" NO).
    if (deviceProperties->deviceDictionary().get("HasTerminationService") == nullptr ||
        deviceProperties->deviceDictionary()
            .get("HasTerminationService")
            ->boolValue()
            .value_or(true))
      terminationService =
          std::make_shared<VSAApplicationTerminationService>(root, clientRegistry, fileSystem);
    // Opening the database stops the process when another daemon holds it.
    codeSigningMapping = std::make_shared<VSACodeSigningMapping>(
        userIdentityCache, globalConfiguration,
        std::make_unique<VSASQLiteDB>(globalConfiguration->libraryDirectory()));
    // The cache and the code-signing mapping point at each other (the mapping
    // stages deletions through the cache); the cache's side is weak so that
    // both go away with the context.
    std::weak_ptr<VSACodeSigningMapping> mapping = codeSigningMapping;
    containerCache = VSAContainerCache::create(
        {userIdentityCache, globalConfiguration, sandboxService, notifications,
         [mapping](const std::string& child) -> std::optional<std::string> {
           auto m = mapping.lock();
           return m ? m->parentIdentifierForChildIdentifier(child) : std::nullopt;
         },
         [list = whitelist](const std::string& id, VSAContainerClass c) {
           return list->containerIdIsWellknown(id, c);
         }});
    stageEnvironment = std::make_shared<VSAStageForDeleteEnvironment>();
    stageEnvironment->cache = containerCache;
    stageEnvironment->configuration = globalConfiguration;
    stageEnvironment->removeCodeSigning = [mapping](const std::string& id, VSACommandQueue& queue) {
      if (auto m = mapping.lock())
        m->removeCodeSigningDictionariesForIdentifierAndItsChildren(id, &queue);
    };
    codeSigningMapping->setStageForDeleteEnvironment(stageEnvironment);
    auto protection = std::make_shared<VSADataProtectionEnvironment>();
    protection->configuration = globalConfiguration;
    protection->userIdentityCache = userIdentityCache;
    protection->containerCache = containerCache;
    protection->transactions = transactions;
    protection->lockStateQueue = lockStateQueue;
    protection->terminationService = terminationService;
    protection->entitlementsForIdentifier = [mapping](const std::string& id) {
      auto m = mapping.lock();
      return m ? m->entitlementsForIdentifier(id) : std::nullopt;
    };
    dataProtectionManager = std::make_shared<VSADataProtectionManager>(protection);
    groupManager =
        std::make_shared<VSAGroupManager>(userIdentityCache, codeSigningMapping, containerCache,
                                          globalConfiguration, stageEnvironment);
    buildOperationServices(mapping);
    buildContainerMigrator();
  }

  // The migrator, with the code-signing pass, whitelist and data-protection
  // answers it needs as functions over this context's objects.
  void buildContainerMigrator() {
    VSAMigrationHooks h;
    h.configuration = globalConfiguration;
    h.userIdentityCache = userIdentityCache;
    h.containerCache = containerCache;
    h.systemVersionPath = systemRoot.resolve("/etc/vessad/system-version.plist");
    h.oldBundleLocation = systemRoot.resolve("/private/var/mobile/Containers/Bundle");
    h.deprecatedContainersPath = systemRoot.resolve("/etc/vessad/deprecated-containers.plist");
    h.wellknownContainerForId = operationServices->wellknownContainerForId;
    h.intendedDataProtectionClass = operationServices->intendedDataProtectionClass;
    std::weak_ptr<VSACodeSigningMapping> mapping = codeSigningMapping;
    h.parentIdentifier = [mapping](const std::string& child) -> std::optional<std::string> {
      auto m = mapping.lock();
      return m ? m->parentIdentifierForChildIdentifier(child) : std::nullopt;
    };
    h.codeSigningMigration = [this](VSACommandQueue& queue, VSAMigrationStatus& status) {
      VSAMigrationMarkers markers{
          [&status](const std::string& t) { return status.hasMigrationOccurredForType(t); },
          [&status](const std::string& t) { return status.setMigrationCompleteForType(t); }};
      return VSACodeSigningMigration(codeSigningMapping, groupManager, containerCache,
                                     globalConfiguration, userIdentityCache, deviceProperties,
                                     std::move(markers))
          .performAllCodeSigningMigrationAndReconciliationWithCommandQueue(queue);
    };
    containerMigrator = std::make_shared<VSAContainerMigrator>(std::move(h));
  }

  // What the container operations work with; the code-signing, whitelist and
  // data-protection answers are functions over this context's objects.
  void buildOperationServices(const std::weak_ptr<VSACodeSigningMapping>& mapping) {
    auto s = std::make_shared<VSAOperationServices>();
    s->configuration = globalConfiguration;
    s->fileManager = fileManager;
    s->containerCache = containerCache;
    s->deathRow = deathRow;
    s->userIdentityCache = userIdentityCache;
    s->subdirectories = subdirectories;
    s->deviceProperties = deviceProperties;
    s->transactions = transactions;
    s->stageEnvironment = stageEnvironment;
    s->isLookupWhitelisted = [list = whitelist](const std::string& client, VSAContainerClass c,
                                                const std::string& id) {
      return list->isLookupWhitelistedFromCodeSignIdentifier(client, c, id);
    };
    s->wellknownContainerForId = [list = whitelist](const std::string& id, VSAContainerClass c) {
      return list->wellknownContainerForId(id, c);
    };
    s->identifierHasSystemContainer = [mapping](const std::string& id) {
      auto m = mapping.lock();
      return m && m->identifierHasSystemContainer(id);
    };
    s->invalidateCodeSigningInfoForIdentifierAndItsChildren = [mapping](const std::string& id,
                                                                        VSAErrorRef* error) {
      auto m = mapping.lock();
      return m && m->invalidateCodeSigningInfoForIdentifierAndItsChildren(id, error);
    };
    std::weak_ptr<VSAGroupManager> groups = groupManager;
    s->reconcileApplicationGroups = [groups](VSACommandQueue& queue) {
      if (auto g = groups.lock())
        g->reconcileGroupContainersOfType(kVSAGroupTypeApplication, queue);
    };
    s->removeAllAdvanceCopies = [mapping](VSAErrorRef* error) {
      auto m = mapping.lock();
      return m && m->removeAllAdvanceCopiesWithError(error);
    };
    s->groupContainerIdentifiersForOwner =
        [groups](const std::string& owner, VSAContainerClass c,
                 VSAResultCode* error) -> std::optional<std::vector<std::string>> {
      auto g = groups.lock();
      if (!g) return std::nullopt;
      VSAValue ownerValue(owner);
      return g->groupContainerIdentifiersForOwnerIdentifier(&ownerValue, c, true, error);
    };
    std::weak_ptr<VSADataProtectionManager> protection = dataProtectionManager;
    s->intendedDataProtectionClass = [protection](const std::string& id) -> int32_t {
      auto p = protection.lock();
      return p ? p->intendedDataProtectionClassBasedOnEntitlementsForIdentifier(id) : 0;
    };
    s->restartPendingDataProtectionOperations = [protection](VSAErrorRef* error) {
      auto p = protection.lock();
      return p && p->restartPendingDataProtectionOperationsWithError(error);
    };
    operationServices = std::move(s);
  }

  VSASystemRoot systemRoot;
  std::shared_ptr<VSADeviceProperties> deviceProperties;
  std::shared_ptr<VSAClientRegistry> clientRegistry;
  std::shared_ptr<VSANotificationCenter> notifications;
  std::shared_ptr<VSALockStateService> lockState;
  std::shared_ptr<VSAUserDatabase> userDatabase;
  std::shared_ptr<VSAPersonaService> personaService;
  std::shared_ptr<VSAFileSystem> fileSystem;
  std::shared_ptr<VSAFileManager> fileManager;
  std::shared_ptr<VSAGlobalConfiguration> globalConfiguration;
  std::shared_ptr<VSATransactions> transactions;
  std::shared_ptr<VSASandboxService> sandboxService;
  std::shared_ptr<VSAContainerSubdirectories> subdirectories;
  std::shared_ptr<VSADeathRow> deathRow;
  std::shared_ptr<VSAUserIdentitySharedCache> userIdentityCache;
  std::shared_ptr<VSAWhitelist> whitelist;
  std::shared_ptr<VSACodeSigningMapping> codeSigningMapping;
  std::shared_ptr<VSAContainerCache> containerCache;
  std::shared_ptr<VSAApplicationTerminationService> terminationService;  // may be null
  std::shared_ptr<VSADataProtectionManager> dataProtectionManager;
  std::shared_ptr<VSAGroupManager> groupManager;  // the default group manager
  std::shared_ptr<VSAStageForDeleteEnvironment> stageEnvironment;
  std::shared_ptr<VSAOperationServices> operationServices;
  std::shared_ptr<VSAContainerMigrator> containerMigrator;

  VSAWorkQueue::Ref listenerQueue;   // "com.tamsk.vessad.listener"
  VSAWorkQueue::Ref deathrowQueue;   // "com.tamsk.vessad.deathrow"
  VSAWorkQueue::Ref lockStateQueue;  // "com.tamsk.vessad.lockstate", suspended while locked

  static std::shared_ptr<VSAFileSystem> wrap(const FileSystemWrapper& wrapper,
                                             std::shared_ptr<VSAFileSystem> fs) {
    return wrapper ? wrapper(std::move(fs)) : fs;
  }

  // Runs `work` on `queue` while holding the daemon busy (a transaction),
  // for work that a reply does not wait for.
  void asyncWithTransaction(const VSAWorkQueue::Ref& queue, std::function<void()> work) {
    auto token = transactions->open();
    queue->async([token, work = std::move(work)] { work(); });
  }
};
