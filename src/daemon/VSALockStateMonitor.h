// The lock-state callback: keeps the lock-state queue suspended exactly
// while the device is locked.
//
// The recorded state starts at 3 (not yet known). State 1 (locked) suspends
// the queue unless it is already recorded as locked; state 0 (unlocked)
// resumes it only after a suspension by this callback; any other state
// changes nothing. So the queue's suspension count never exceeds one.
// Called on the main queue only (once directly at start-up, then for each
// lock-status notification), which is why it needs no lock.
#pragma once

#include <cstdint>
#include <functional>

#include "base/VSAWorkQueue.h"

class VSALockStateMonitor {
 public:
  VSALockStateMonitor(VSAWorkQueue::Ref lockStateQueue, std::function<int()> currentLockState);

  void lockStateDidChange();
  uint32_t recordedState() const { return recorded_; }

 private:
  VSAWorkQueue::Ref queue_;
  std::function<int()> currentLockState_;
  uint32_t recorded_ = 3;
};
