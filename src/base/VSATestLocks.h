// Test locks: points where a test client can freeze the daemon to provoke
// races (internal builds only; command 31 acquires and releases them).
//
// Seven numbered locks, each with a signed count of acquisitions; counts
// change only on the serial state queue. A count going from 0 to positive
// takes the lock, from positive to 0 releases it:
//  - lock 0 takes the all-identifiers lock for writing (every container
//    operation stops at its identifier lock), lock 1 for reading (only
//    operations that write stop). That lock may have to wait for an
//    operation already frozen at another test lock, so it is taken on a
//    queue of its own: the state queue and the command's mask are never held
//    while it waits, and a release that comes before the lock was had is
//    settled by the taker as soon as it has it. acquireLock() returns once
//    the lock is held, but nothing else waits with it;
//  - locks 2-6 put a barrier on their own concurrent queue that waits on the
//    lock's semaphore; waitOnLock() on that number runs an empty block
//    synchronously on the queue, so it blocks behind the barrier until the
//    lock is released. Waiters never block the state queue.
// Where the daemon waits: 2 creation (between staging and the rename into
// place), 3 replace (between its renames), 4 stage-for-delete (before the
// move to death row), 5 protection change (before the walk), 6 the cache
// rebuild of a class.
//
// Releasing never waits for anyone. With the feature off, waitOnLock() returns
// at once. A release that would make a count negative ends the process.
// Thread-safe; one per daemon instance, over that daemon's lock table.
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <future>
#include <memory>
#include <mutex>
#include <semaphore>

#include "base/VSAError.h"
#include "base/VSALocks.h"
#include "base/VSAWorkQueue.h"

inline constexpr uint64_t kVSATestLockCount = 7;
inline constexpr uint64_t kVSATestLockCreate = 2;
inline constexpr uint64_t kVSATestLockReplace = 3;
inline constexpr uint64_t kVSATestLockStageForDelete = 4;
inline constexpr uint64_t kVSATestLockProtectionChange = 5;
inline constexpr uint64_t kVSATestLockCacheRebuild = 6;

class VSATestLocks {
 public:
  explicit VSATestLocks(std::shared_ptr<VSALocks> locks);
  ~VSATestLocks();
  VSATestLocks(const VSATestLocks&) = delete;
  VSATestLocks& operator=(const VSATestLocks&) = delete;

  bool enabled() const { return enabled_.load(std::memory_order_acquire); }
  // Turning off releases every lock.
  void setEnabled(bool enabled);
  void acquireLock(uint64_t lock);
  void releaseLock(uint64_t lock);
  void releaseAllLocks();
  // Blocks while `lock` (2-6) is held and the feature is on.
  void waitOnLock(uint64_t lock);
  int64_t countForLock(uint64_t lock) const;

  // Command 31: lock 7 with enable false turns the feature off; 7 or more
  // otherwise is 38. Enabling a lock the command holds already, or
  // disabling one it does not hold, does nothing; disabling lock 0 or 1
  // drops both from the command's mask; an empty mask turns the feature off.
  VSAResultCode setLockFromCommand(uint64_t lock, bool enable);

 private:
  struct Gate {
    VSAWorkQueue::Ref queue;
    std::unique_ptr<std::binary_semaphore> semaphore;
  };
  // The all-identifiers lock held for lock 0 or 1: how often it is held, and
  // how many releases came before their acquisition had finished.
  struct Holding {
    std::mutex mutex;
    int64_t held = 0;
    int64_t owed = 0;
  };
  // Changes a count; `taken` (when given) becomes the acquisition to wait for.
  void updateCount(uint64_t lock, int64_t delta, std::shared_future<void>* taken = nullptr);
  void _stateQueue_updateCountForLock(uint64_t lock, int64_t delta,
                                      std::shared_future<void>* taken = nullptr);
  std::shared_future<void> take(uint64_t lock);
  void release(uint64_t lock);

  std::shared_ptr<VSALocks> locks_;
  std::atomic<bool> enabled_{false};
  VSAWorkQueue::Ref stateQueue_;
  std::array<int64_t, kVSATestLockCount> counts_{};  // on the state queue
  std::array<Gate, kVSATestLockCount> gates_;        // locks 2-6
  VSAWorkQueue::Ref takerQueue_;                     // takes locks 0 and 1
  std::array<Holding, 2> holdings_;                  // locks 0 and 1
  std::mutex maskMutex_;
  uint32_t commandMask_ = 0;
};
