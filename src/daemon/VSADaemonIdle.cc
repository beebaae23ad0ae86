// Leaving when idle, under socket activation: the service manager holds both
// sockets, so what arrives after the daemon left starts it again.
#include <vector>

#include "base/VSALog.h"
#include "daemon/VSADaemon.h"
#include "platform/VSAFileSystem.h"

void VSADaemon::checkIdleExitIsPossible() {
  if (idleExitSeconds_ <= 0) return;
  std::lock_guard lock(listenerMutex_);
  // Start-up may already have handed the upcall's listener over.
  VSAUpcallListener* upcall = upcallListener_ ? upcallListener_.get()
                              : upcall_       ? upcall_->listener()
                                              : nullptr;
  bool inherited =
      listener_ && listener_->socketIsInherited() && upcall && upcall->socketIsInherited();
  if (inherited) return;
  idleExitSeconds_ = 0;
  VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "main",
           "Staying when idle: the sockets are not both the service manager's, so nothing "
           "would start the daemon again");
}

bool VSADaemon::isIdle(uint64_t* activity) {
  if (!initialized_ || !cleanupsDone_ || testLocksInUse_ || stopping_) return false;
  if (context_->transactions->openCount() != 0) return false;
  uint64_t upcalls = 0;
  {
    std::lock_guard lock(listenerMutex_);
    if (!listener_ || listener_->connectionCount() != 0) return false;
    VSAUpcallListener* upcall = upcall_ ? upcall_->listener() : nullptr;
    if (!upcall || upcall->peerCount() != 0) return false;
    upcalls = upcall->acceptedCount();
  }
  // Protection changes waiting for an unlock need the daemon to see it.
  std::vector<VSADirectoryEntry> pending;
  if (context_->fileSystem->readDirectory(context_->globalConfiguration->pendingUpdatesDirectory(),
                                          &pending) == 0 &&
      !pending.empty())
    return false;
  *activity = context_->transactions->openedCount() + upcalls;
  return true;
}

void VSADaemon::holdAccepting(bool hold) {
  std::lock_guard lock(listenerMutex_);
  if (listener_) listener_->holdAccepting(hold);
  if (upcall_ && upcall_->listener()) upcall_->listener()->holdAccepting(hold);
}

bool VSADaemon::exitIfIdle() {
  uint64_t activity = 0;
  bool idle = isIdle(&activity);
  bool quiet = idle && wasIdle_ && activity == lastActivity_;
  wasIdle_ = idle;
  lastActivity_ = activity;
  if (!quiet || idleExitSeconds_ <= 0) return false;
  // Held, the sockets take no one in; whoever got in before is counted now.
  holdAccepting(true);
  uint64_t again = 0;
  if (!isIdle(&again) || again != activity) {
    holdAccepting(false);
    wasIdle_ = false;
    return false;
  }
  VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "main",
           "Idle for %d seconds with no client, transaction or background work: leaving; the "
           "service manager keeps both sockets",
           idleExitSeconds_.load());
  requestStop();
  return true;
}
