#include "daemon/VSADaemon.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstring>

#include "base/VSACommands.h"
#include "base/VSACrash.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "base/VSATestLocks.h"
#include "daemon/VSACommandTable.h"
#include "daemon/VSAStateDump.h"
#include "platform/VSANamedSemaphore.h"
#include "platform/VSAServiceManager.h"

// The start-up line reports when this file was compiled. A time stamped at
// configure would change on every configure and rebuild and relink every
// binary each time a script runs the build.
#define VESSA_BUILD_DATE __DATE__
#define VESSA_BUILD_TIME __TIME__

VSADaemon::VSADaemon(Options options)
    : options_(std::move(options)),
      context_(std::make_unique<VSADaemonContext>(VSASystemRoot(options_.root),
                                                  VSADaemonContext::FileSystemWrapper{}, false)),
      stateQueue_(VSAWorkQueue::create("com.tamsk.vessad.state")) {
  firstBootSemaphore_ =
      VSANamedSemaphore::nameForRoot(kVSAFirstBootSemaphore, context_->systemRoot);
  if (options_.afterBoot) VSANamedSemaphore::remove(firstBootSemaphore_);
  VSALogger::shared().setLevel(options_.logLevel);
  idleExitSeconds_ = options_.idleExitSeconds;
}

// A dump under way reads this daemon's objects: it ends first.
VSADaemon::~VSADaemon() {
  stopping_ = true;
  stateQueue_->sync([] {});
}

int VSADaemon::run() {
  VSAMakeDirectories(context_->systemRoot.runDirectory());
  writePidFile();
  context_->listenerQueue = VSAWorkQueue::create("com.tamsk.vessad.listener");
  auto initTransaction = context_->transactions->open();
  // Concurrent: a command that waits to take lock 0 or 1 must not hold up the
  // release that lets it through.
  testLockQueue_ =
      VSAWorkQueue::create("com.tamsk.vessad.testlocks", VSAWorkQueue::Kind::Concurrent);
  testLockQueue_->suspend();
  // Both sockets take connections from here on; initialisation starts
  // serving the upcall's, so an upcall made meanwhile waits in its backlog
  // instead of failing.
  upcallListener_ = VSAKernelUpcall::listenerFor(*context_);
  if (VSAErrorRef error; !upcallListener_->bind(&error))
    VSALogIn(VSALogCategory::Upcall, kVSALogError, "main", "bootstrap_check_in: %s",
             error ? error->message() : std::string("unknown error"));
  context_->listenerQueue->async([this, initTransaction = std::move(initTransaction)]() mutable {
    initialize();
    initialized_ = true;
    VSAServiceManager::notifyReady(cleanupsDone_ ? "Serving" : "Serving; boot cleanup running");
    testLockQueue_->resume();
    initTransaction.reset();  // step 15: start-up is over
  });
  dispatcher_ = std::make_unique<VSARelayDispatcher>(*context_);
  {
    std::lock_guard lock(listenerMutex_);
    listener_ =
        std::make_unique<VSAIPCListener>(context_->systemRoot.socketPath(), context_->listenerQueue,
                                         context_->transactions, context_->clientRegistry);
    VSAErrorRef error;
    if (!stopping_ && listener_->listen(&error)) {
      listener_->setHandler(
          [this](const VSAIPCMessageRef& m) { dispatcher_->processRelayEvent(m); });
      listener_->setRouter([this](const VSAValue& body) { return routeRequest(body); });
      listener_->resume();
    } else {
      if (!stopping_) {
        VSALogIn(VSALogCategory::Daemon, kVSALogError, "main", "unable to start relay service!");
        VSALogIn(VSALogCategory::Daemon, kVSALogError, "main", "%@", error);
      }
      listener_.reset();
    }
  }
  checkIdleExitIsPossible();
  VSAWorkQueue::runMain();
  {
    std::lock_guard lock(listenerMutex_);
    if (listener_) listener_->stop();
  }
  context_->fileManager->removeFileAtURL(
      VSAPathJoin(context_->systemRoot.runDirectory(), kVSAPidFileName), nullptr);
  VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "main", "vessad stopped");
  VSALogger::shared().closeRotatingLog();
  return 0;
}

// Test-lock commands have their own queue, so that one can thaw requests
// frozen on the listener's queue (and one another). Every other request is handled on the
// listener's I/O thread while the listener's queue is idle: a look-up then
// costs no thread hand-off. Its handler waits for nothing but locks and the
// disk, so the I/O thread is back within the request's own time.
VSAIPCListener::Route VSADaemon::routeRequest(const VSAValue& body) {
  const VSAValue* command = body.get(kVSARequestCommandKey);
  if (command && command->uint64Value() == VSACommands::kTestLock) {
    testLocksInUse_ = true;
    return {testLockQueue_, false};
  }
  bool mayFreeze = testLocksInUse_ || context_->testLocks->enabled();
  return {nullptr, !mayFreeze};
}

void VSADaemon::requestStop() {
  if (stopping_.exchange(true)) return;
  VSAServiceManager::notifyStopping();
  // Drained on the caller's thread: the main loop must keep running
  // meanwhile, because start-up (which may still be under way) calls into it.
  drainForShutdown();
  VSAWorkQueue::stopMain();
}

void VSADaemon::requestStateDump() {
  if (stopping_) return;
  uint64_t generation = ++dumpGeneration_;
  stateQueue_->async([this, generation] {
    // Before start-up has set the subsystems, the state is only that.
    if (!initialized_) {
      VSAStateDump(*context_, {}).publish(VSAStateDump::startingUp(generation));
      return;
    }
    VSAStateDump dump(*context_, {testLockQueue_, stateQueue_});
    dump.publish(dump.collect(generation));
  });
}

// The daemon's pid, for `vessactl status` (which signals it); written
// atomically, so a reader never sees half a number.
void VSADaemon::writePidFile() {
  std::string text = std::to_string(::getpid()) + "\n";
  std::string path = VSAPathJoin(context_->systemRoot.runDirectory(), kVSAPidFileName);
  VSAErrorRef error;
  if (!context_->fileManager->writeFileAtomicallyAtURL(
          path, std::vector<uint8_t>(text.begin(), text.end()), 0644, std::nullopt, &error))
    VSALogIn(VSALogCategory::Daemon, kVSALogError, "main", "Failed to write %@: %@", path, error);
}

void VSADaemon::drainForShutdown() {
  VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "main",
           "Stopping: no new requests; waiting for %d open transactions",
           context_->transactions->openCount());
  // A request frozen at a test lock would hold its transaction open forever,
  // and one frozen on an I/O thread would hold up the stops below. Turned off
  // again after them, in case a test-lock command came in meanwhile.
  context_->testLocks->setEnabled(false);
  {
    std::lock_guard lock(listenerMutex_);
    if (listener_) listener_->stopAccepting();
    // Upcalls already received are still answered: their replies hold the peer.
    if (upcall_) upcall_->stop();
  }
  context_->testLocks->setEnabled(false);
  if (!context_->transactions->waitUntilIdle(std::chrono::seconds(30)))
    VSALogIn(VSALogCategory::Daemon, kVSALogError, "main",
             "Giving up on %d open transactions after 30 seconds",
             context_->transactions->openCount());
}

void VSADaemon::openLogs() {
  // Before any subsystem exists, so that their start-up lines are kept.
  std::string directory = VSAGlobalConfiguration::logDirectoryForRoot(context_->systemRoot);
  VSAErrorRef directoryError;
  if (!context_->fileManager->createDirectoryAtURL(directory, true, 0755, 0, 4, &directoryError))
    VSALogIn(VSALogCategory::Daemon, kVSALogError, "vessad_init",
             "Failed to create log directory at \"%@\": %@", directory, directoryError);
  std::string path = VSAPathJoin(directory, "vessad.log");
  auto& logger = VSALogger::shared();
  if (!logger.openRotatingLog(path, options_.logLevel)) {
    VSALogIn(VSALogCategory::Daemon, kVSALogError, "vessad_init",
             "Failed to set up rotating logs at path %s", path);
  }
  bool internal = context_->deviceProperties->hasInternalContent();
  logger.enableDiskLogging(internal ? 4 : 1, internal ? 262144 : 102400);
  if (logger.level() >= kVSALogDebug)
    VSALogIn(VSALogCategory::Daemon, kVSALogDebug, "vessad_init", "vessad built at %s %s started",
             VESSA_BUILD_DATE, VESSA_BUILD_TIME);
}

bool VSADaemon::isFirstBoot() {
  switch (VSANamedSemaphore::stateOf(firstBootSemaphore_)) {
    case VSANamedSemaphore::State::Present:
      return false;
    case VSANamedSemaphore::State::Forged:
      // Anyone can make a file by that name; only one the daemon made says
      // that first-boot work was done since the device started.
      VSALogIn(VSALogCategory::Daemon, kVSALogError, "vessad_init",
               "Ignoring first-boot marker %s: not made by vessad; removing it",
               VSANamedSemaphore::backingPath(firstBootSemaphore_));
      VSANamedSemaphore::remove(firstBootSemaphore_);
      break;
    case VSANamedSemaphore::State::Absent:
      break;
  }
  VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "vessad_init",
           "vessad performing first boot initialization");
  return true;
}

void VSADaemon::initialize() {
  VSASignpostInterval startingUp(VSALogCategory::Startup, "StartingUp");
  openLogs();
  context_->buildSubsystems();
  context_->deathrowQueue =
      VSAWorkQueue::create("com.tamsk.vessad.deathrow", VSAWorkQueue::Kind::Serial,
                           VSAWorkQueue::global(VSAWorkQueue::Priority::Background));
  if (!context_->deathrowQueue || !context_->lockStateQueue)
    VSACrash("Can't create dispatch queues.");
  // The queue matches the lock state before boot setup: a pending
  // protection change restarted there while the device is locked must wait
  // for the unlock rather than retry at once.
  lockStateMonitor_ = std::make_unique<VSALockStateMonitor>(
      context_->lockStateQueue,
      [lockState = context_->lockState] { return lockState->currentLockState(); });
  VSAWorkQueue::main()->sync(
      [monitor = lockStateMonitor_.get()] { monitor->lockStateDidChange(); });
  sharedConnection_ = VSAClientConnection::sharedClientConnection(*context_);

  bool firstBoot = isFirstBoot();
  if (firstBoot) {
    VSAServiceManager::notifyStatus("First start after boot: upgrade migration, restores");
    VSASignpostInterval interval(VSALogCategory::Startup, "FirstBootSetup");
    sharedConnection_->rebootKeeperSetup();
  }
  {
    VSAServiceManager::notifyStatus("Boot setup: replace recovery, pending protection changes");
    VSASignpostInterval interval(VSALogCategory::Startup, "BootSetup");
    sharedConnection_->keeperSetup();
  }
  {
    std::lock_guard lock(listenerMutex_);
    upcall_ = std::make_unique<VSAKernelUpcall>(*context_, context_->listenerQueue);
    if (!upcall_->start(std::move(upcallListener_)))
      VSACrash("Failed to initialize kernel upcall interface.");
  }

  int status = context_->lockState->registerForLockStatus(
      VSAWorkQueue::main(), [monitor = lockStateMonitor_.get()] { monitor->lockStateDidChange(); });
  if (status != 0)
    VSALogIn(VSALogCategory::Daemon, kVSALogError, "vessad_init",
             "notify_register_dispatch for notification \"%s\" failed; returned %d\n",
             kVSALockStatusNotification, status);
  // The callback belongs to the main queue; run this first call there too.
  VSAWorkQueue::main()->sync(
      [monitor = lockStateMonitor_.get()] { monitor->lockStateDidChange(); });
  startCleanups(firstBoot);
}

void VSADaemon::startCleanups(bool firstBoot) {
  auto notifications = context_->notifications;
  if (firstBoot) {
    uint64_t signpost = VSASignpostBegin(VSALogCategory::Startup, "FirstBootCleanup");
    std::string semaphore = firstBootSemaphore_;
    sharedConnection_->rebootKeeperCleanupWithCompletion([notifications, semaphore, signpost] {
      VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "vessad_init",
               "vessad first boot cleanup complete");
      if (!VSANamedSemaphore::create(semaphore))
        VSALogIn(VSALogCategory::Daemon, kVSALogError, "set_first_boot_work_completed",
                 "Failed to create semaphore %s: %s", semaphore, std::strerror(errno));
      if (uint32_t s = notifications->post(CONTAINER_NOTIFY_REBOOT_CLEANUP_COMPLETE))
        VSALogIn(VSALogCategory::Startup, kVSALogError, "vessad_init",
                 "Failed to post reboot-cleanup-complete: %u", s);
      VSASignpostEnd(VSALogCategory::Startup, "FirstBootCleanup", signpost);
    });
  }
  uint64_t signpost = VSASignpostBegin(VSALogCategory::Startup, "BootCleanup");
  sharedConnection_->keeperCleanupWithCompletion([this, notifications, signpost] {
    cleanupsDone_ = true;
    VSAServiceManager::notifyStatus("Serving; boot cleanup complete");
    if (uint32_t s = notifications->post(CONTAINER_NOTIFY_CLEANUP_COMPLETE))
      VSALogIn(VSALogCategory::Startup, kVSALogError, "vessad_init",
               "Failed to post cleanup-complete: %u", s);
    VSASignpostEnd(VSALogCategory::Startup, "BootCleanup", signpost);
  });
}
