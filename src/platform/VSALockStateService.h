// The device lock-state service of a system root.
//
// The state lives in `<root>/run/vessad/lockstate`: "1" locked, "0"
// unlocked; any other number is passed on as it is (callers ignore states
// they do not know); a missing file means unlocked. Changes are noticed with
// inotify and reported as the lock-status notification on a given queue.
// setLockState() is how a test (or the demo) locks and unlocks the device.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "base/VSAWorkQueue.h"
#include "platform/VSAInotifyWatcher.h"
#include "platform/VSASystemRoot.h"

inline constexpr const char* kVSALockStatusNotification = "com.tamsk.vessad.lockstate-changed";

class VSALockStateService {
 public:
  explicit VSALockStateService(VSASystemRoot root);
  ~VSALockStateService();

  std::string stateFilePath() const;
  int currentLockState() const;
  bool setLockState(int state);
  // Registers for the lock-status notification; 0 on success, else an errno.
  int registerForLockStatus(VSAWorkQueue::Ref queue, std::function<void()> handler);

 private:
  VSASystemRoot root_;
  std::unique_ptr<VSAInotifyWatcher> watcher_;
};
