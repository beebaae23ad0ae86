#include "daemon/VSALockStateMonitor.h"

#include "base/VSALog.h"

VSALockStateMonitor::VSALockStateMonitor(VSAWorkQueue::Ref lockStateQueue,
                                         std::function<int()> currentLockState)
    : queue_(std::move(lockStateQueue)), currentLockState_(std::move(currentLockState)) {}

void VSALockStateMonitor::lockStateDidChange() {
  int state = currentLockState_();
  VSALogIn(VSALogCategory::Daemon, kVSALogDebug, "lock_state_changed", "LockState=%d", state);
  if (state == 1) {
    if (recorded_ != 1) queue_->suspend();
    recorded_ = 1;
  } else if (state == 0) {
    if (recorded_ == 1) queue_->resume();
    recorded_ = 0;
  }
}
