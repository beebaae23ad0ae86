#include "base/VSATestLocks.h"

#include "base/VSACrash.h"
#include "base/VSAFormat.h"
#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAUUID.h"

namespace {
constexpr const char* kOrigin = "VSATestLocks";

void logTest(const char* origin, std::string_view format, auto... args) {
  VSALogIn(VSALogCategory::Test, kVSALogNotice, origin, format, args...);
}

bool hasGate(uint64_t lock) { return lock >= 2 && lock < kVSATestLockCount; }
}  // namespace

VSATestLocks::VSATestLocks(std::shared_ptr<VSALocks> locks)
    : locks_(std::move(locks)),
      stateQueue_(VSAWorkQueue::create("com.tamsk.vessad.VSATestLocks.stateQueue")),
      takerQueue_(VSAWorkQueue::create("com.tamsk.vessad.VSATestLocks.takerQueue")) {
  for (uint64_t lock = 2; lock < kVSATestLockCount; ++lock) {
    gates_[lock].queue = VSAWorkQueue::create("com.tamsk.vessad.VSATestLocks.lockQueue",
                                              VSAWorkQueue::Kind::Concurrent);
    gates_[lock].semaphore = std::make_unique<std::binary_semaphore>(0);
  }
}

VSATestLocks::~VSATestLocks() {
  releaseAllLocks();
  // A released barrier may still be returning from its semaphore: wait for
  // it before the semaphore goes.
  for (uint64_t lock = 2; lock < kVSATestLockCount; ++lock) gates_[lock].queue->barrierSync([] {});
  takerQueue_->sync([] {});
}

void VSATestLocks::setEnabled(bool enabled) {
  if (enabled_.exchange(enabled) == enabled) return;
  if (enabled) {
    logTest("setEnabled", "Enabled test locks feature.");
  } else {
    releaseAllLocks();
    logTest("setEnabled", "Disabled test locks feature.");
  }
}

void VSATestLocks::acquireLock(uint64_t lock) {
  std::shared_future<void> taken;
  updateCount(lock, 1, &taken);
  // Waited for here, with nothing of this object held.
  if (taken.valid()) taken.wait();
}

void VSATestLocks::releaseLock(uint64_t lock) { updateCount(lock, -1); }

void VSATestLocks::updateCount(uint64_t lock, int64_t delta, std::shared_future<void>* taken) {
  if (lock >= kVSATestLockCount) return;
  stateQueue_->sync([&] { _stateQueue_updateCountForLock(lock, delta, taken); });
}

void VSATestLocks::releaseAllLocks() {
  stateQueue_->sync([&] {
    for (uint64_t lock = 0; lock < kVSATestLockCount; ++lock)
      if (counts_[lock] > 0) _stateQueue_updateCountForLock(lock, -counts_[lock]);
    logTest("releaseAllLocks", "Released all test locks.");
  });
}

int64_t VSATestLocks::countForLock(uint64_t lock) const {
  if (lock >= kVSATestLockCount) return 0;
  int64_t count = 0;
  stateQueue_->sync([&] { count = counts_[lock]; });
  return count;
}

void VSATestLocks::_stateQueue_updateCountForLock(uint64_t lock, int64_t delta,
                                                  std::shared_future<void>* taken) {
  if (delta == 0) return;
  int64_t from = counts_[lock], to = from + delta;
  if (to < 0) {
    std::string message = VSAFormat("Unbalanced update to test lock: %llu by: %ld from: %ld",
                                    static_cast<unsigned long long>(lock), static_cast<long>(delta),
                                    static_cast<long>(from));
    VSALogIn(VSALogCategory::Test, kVSALogFault, "_stateQueue_updateCountForLock", "%@", message);
    VSACrash(message);
  }
  counts_[lock] = to;
  if (from == 0) {
    auto acquisition = take(lock);
    if (taken) *taken = std::move(acquisition);
  }
  if (to == 0) release(lock);
  if (delta > 0)
    logTest(kOrigin, "Acquired test lock: %llu; count: %ld", static_cast<unsigned long long>(lock),
            static_cast<long>(to));
  else
    logTest(kOrigin, "Released test lock: %llu; count: %ld", static_cast<unsigned long long>(lock),
            static_cast<long>(to));
}

std::shared_future<void> VSATestLocks::take(uint64_t lock) {
  if (lock <= 1) {
    // The all-identifiers lock waits for every identifier lock, and one may be
    // held by an operation frozen at another test lock: only the taker waits.
    auto done = std::make_shared<std::promise<void>>();
    std::shared_future<void> taken = done->get_future().share();
    takerQueue_->async([lock, done, &holding = holdings_[lock], &locks = *locks_] {
      if (lock == 0)
        locks.lock_all_identifiers_write();
      else
        locks.lock_all_identifiers_read();
      {
        std::lock_guard guard(holding.mutex);
        if (holding.owed > 0) {
          --holding.owed;
          locks.unlock_all_identifiers();
        } else {
          ++holding.held;
        }
      }
      done->set_value();
    });
    return taken;
  }
  Gate& gate = gates_[lock];
  gate.queue->barrierAsync([lock, semaphore = gate.semaphore.get()] {
    logTest("take", "Blocking waiters for lock: %llu", static_cast<unsigned long long>(lock));
    semaphore->acquire();
    logTest("take", "Unblocking waiters for lock: %llu", static_cast<unsigned long long>(lock));
  });
  return {};
}

void VSATestLocks::release(uint64_t lock) {
  if (lock > 1) return gates_[lock].semaphore->release();
  // Not had yet: the taker lets it go the moment it gets it.
  Holding& holding = holdings_[lock];
  std::lock_guard guard(holding.mutex);
  if (holding.held > 0) {
    --holding.held;
    locks_->unlock_all_identifiers();
  } else {
    ++holding.owed;
  }
}

void VSATestLocks::waitOnLock(uint64_t lock) {
  if (!enabled()) return;
  std::string mark = VSAUUID::random().string();
  auto number = static_cast<unsigned long long>(lock);
  logTest("waitOnLock", "[%s] Waiting on lock: %llu", mark, number);
  if (hasGate(lock)) gates_[lock].queue->sync([] {});
  logTest("waitOnLock", "[%s] No longer waiting on lock: %llu", mark, number);
}

VSAResultCode VSATestLocks::setLockFromCommand(uint64_t lock, bool enable) {
  if (lock == kVSATestLockCount && !enable) {
    std::lock_guard guard(maskMutex_);
    commandMask_ = 0;
    setEnabled(false);
    return VSAResult::kSuccess;
  }
  if (lock >= kVSATestLockCount) {
    VSALogIn(VSALogCategory::Test, kVSALogError, "setLockFromCommand", "Invalid test lock: %llu",
             static_cast<unsigned long long>(lock));
    return VSAResult::kOutOfRange;
  }
  std::unique_lock guard(maskMutex_);
  uint32_t bit = 1u << lock;
  if (enable) {
    if (commandMask_ & bit) return VSAResult::kSuccess;
    commandMask_ |= bit;
    setEnabled(true);
    std::shared_future<void> taken;
    updateCount(lock, 1, &taken);
    // Other test-lock commands (a release that thaws what this one waits
    // for, among them) go on meanwhile.
    guard.unlock();
    if (taken.valid()) taken.wait();
    return VSAResult::kSuccess;
  }
  if (!(commandMask_ & bit)) return VSAResult::kSuccess;
  // Releasing lock 0 or 1 forgets both: the command treats them as one.
  commandMask_ &= lock <= 1 ? ~3u : ~bit;
  releaseLock(lock);
  if (commandMask_ == 0) setEnabled(false);
  return VSAResult::kSuccess;
}
