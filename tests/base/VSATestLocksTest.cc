// Test locks: what freezes and what does not, the command's mask rules, and
// the unbalanced release that ends the process.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>

#include "base/VSALocks.h"
#include "base/VSATestLocks.h"

namespace {

using namespace std::chrono_literals;

// Starts a waiter on `lock`; the future is ready once it got through.
std::future<void> waiter(VSATestLocks& locks, uint64_t lock) {
  return std::async(std::launch::async, [&locks, lock] { locks.waitOnLock(lock); });
}

TEST(VSATestLocks, AHeldLockStopsItsWaitersUntilReleasedAndOnlyWhenEnabled) {
  auto shared = std::make_shared<VSALocks>();
  [[maybe_unused]] VSALocks& table = *shared;
  VSATestLocks locks(shared);
  // Off: counts do not matter.
  locks.acquireLock(3);
  EXPECT_EQ(waiter(locks, 3).wait_for(5s), std::future_status::ready);
  locks.releaseLock(3);

  locks.setEnabled(true);
  locks.acquireLock(3);
  locks.acquireLock(3);  // a second hold: one release is not enough
  EXPECT_EQ(locks.countForLock(3), 2);
  auto blocked = waiter(locks, 3);
  auto other = waiter(locks, 4);  // another number is not held
  EXPECT_EQ(other.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(blocked.wait_for(200ms), std::future_status::timeout);
  locks.releaseLock(3);
  EXPECT_EQ(blocked.wait_for(200ms), std::future_status::timeout);
  locks.releaseLock(3);
  EXPECT_EQ(blocked.wait_for(5s), std::future_status::ready);
  // Taken again, released by turning the feature off.
  locks.acquireLock(5);
  auto again = waiter(locks, 5);
  EXPECT_EQ(again.wait_for(200ms), std::future_status::timeout);
  locks.setEnabled(false);
  EXPECT_EQ(again.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(locks.countForLock(5), 0);
}

TEST(VSATestLocks, LocksZeroAndOneHoldTheAllIdentifiersLock) {
  auto shared = std::make_shared<VSALocks>();
  [[maybe_unused]] VSALocks& table = *shared;
  VSATestLocks locks(shared);
  locks.setEnabled(true);
  locks.acquireLock(0);
  EXPECT_EQ(table.snapshot().allReaderWriterState, -1);  // writing
  // An identifier writer waits until the test lock goes.
  auto writer = std::async(std::launch::async, [&table] {
    VSAIdentifierLockGuard guard(table, VSAValue("TESTLOCK-KEY"), true);
  });
  EXPECT_EQ(writer.wait_for(200ms), std::future_status::timeout);
  locks.releaseLock(0);
  EXPECT_EQ(writer.wait_for(5s), std::future_status::ready);
  locks.acquireLock(1);
  EXPECT_EQ(table.snapshot().allReaderWriterState, 1);  // reading
  {
    VSAIdentifierLockGuard reader(table, VSAValue("TESTLOCK-KEY"), false);  // readers pass
  }
  locks.releaseAllLocks();
  EXPECT_EQ(table.snapshot().allReaderWriterState, 0);
}

TEST(VSATestLocks, TheCommandAcquiresOncePerLockAndChecksNumbers) {
  auto shared = std::make_shared<VSALocks>();
  [[maybe_unused]] VSALocks& table = *shared;
  VSATestLocks locks(shared);
  EXPECT_EQ(locks.setLockFromCommand(7, true), VSAResult::kOutOfRange);
  EXPECT_EQ(locks.setLockFromCommand(8, false), VSAResult::kOutOfRange);
  EXPECT_EQ(locks.setLockFromCommand(UINT64_MAX, true), VSAResult::kOutOfRange);
  EXPECT_FALSE(locks.enabled());
  // Disabling what the command does not hold does nothing.
  EXPECT_EQ(locks.setLockFromCommand(2, false), VSAResult::kSuccess);
  EXPECT_FALSE(locks.enabled());

  EXPECT_EQ(locks.setLockFromCommand(2, true), VSAResult::kSuccess);
  EXPECT_EQ(locks.setLockFromCommand(2, true), VSAResult::kSuccess);
  EXPECT_TRUE(locks.enabled());
  EXPECT_EQ(locks.countForLock(2), 1);
  EXPECT_EQ(locks.setLockFromCommand(6, true), VSAResult::kSuccess);
  EXPECT_EQ(locks.setLockFromCommand(2, false), VSAResult::kSuccess);
  EXPECT_EQ(locks.countForLock(2), 0);
  EXPECT_TRUE(locks.enabled());  // lock 6 is still held
  EXPECT_EQ(locks.setLockFromCommand(6, false), VSAResult::kSuccess);
  EXPECT_FALSE(locks.enabled());  // the mask emptied

  // Releasing lock 1 forgets lock 0 as well; 7 with enable false ends it all.
  EXPECT_EQ(locks.setLockFromCommand(0, true), VSAResult::kSuccess);
  locks.releaseLock(0);  // back to a lock the tests can take on one thread
  EXPECT_EQ(locks.setLockFromCommand(3, true), VSAResult::kSuccess);
  EXPECT_EQ(locks.setLockFromCommand(1, true), VSAResult::kSuccess);
  EXPECT_EQ(locks.setLockFromCommand(1, false), VSAResult::kSuccess);
  EXPECT_EQ(locks.countForLock(1), 0);
  EXPECT_EQ(locks.setLockFromCommand(0, false), VSAResult::kSuccess);  // no longer in the mask
  EXPECT_TRUE(locks.enabled());
  EXPECT_EQ(locks.setLockFromCommand(7, false), VSAResult::kSuccess);
  EXPECT_FALSE(locks.enabled());
  EXPECT_EQ(locks.countForLock(3), 0);
  EXPECT_EQ(table.snapshot().allReaderWriterState, 0);
}

// Turning everything off also forgets what the command held, so the
// command's next enable takes the lock again and its next disable never
// releases a lock that is no longer held (which would end the process).
TEST(VSATestLocks, TurningEverythingOffLeavesTheCommandNothingToReleaseTwice) {
  auto shared = std::make_shared<VSALocks>();
  [[maybe_unused]] VSALocks& table = *shared;
  VSATestLocks locks(shared);
  ASSERT_EQ(locks.setLockFromCommand(3, true), VSAResult::kSuccess);
  ASSERT_EQ(locks.setLockFromCommand(7, false), VSAResult::kSuccess);
  EXPECT_FALSE(locks.enabled());
  EXPECT_EQ(locks.countForLock(3), 0);
  EXPECT_EQ(locks.setLockFromCommand(3, false), VSAResult::kSuccess);  // nothing held
  EXPECT_EQ(locks.countForLock(3), 0);
  EXPECT_EQ(locks.setLockFromCommand(3, true), VSAResult::kSuccess);
  EXPECT_TRUE(locks.enabled());
  EXPECT_EQ(locks.countForLock(3), 1);
  EXPECT_EQ(locks.setLockFromCommand(3, false), VSAResult::kSuccess);
  EXPECT_FALSE(locks.enabled());
}

// An operation frozen at lock 3 holds its identifier lock, so lock 0 cannot
// be had until it goes on; neither the release that lets it go on, nor
// turning the feature off, may wait for that.
TEST(VSATestLocks, ReleasesNeverWaitBehindALockZeroThatCannotBeHadYet) {
  auto shared = std::make_shared<VSALocks>();
  [[maybe_unused]] VSALocks& table = *shared;
  VSATestLocks locks(shared);
  ASSERT_EQ(locks.setLockFromCommand(3, true), VSAResult::kSuccess);
  auto frozen = std::async(std::launch::async, [&locks, &table] {
    VSAIdentifierLockGuard guard(table, VSAValue("FROZEN-KEY"), true);
    locks.waitOnLock(3);
  });
  EXPECT_EQ(frozen.wait_for(200ms), std::future_status::timeout);
  auto lockZero = std::async(std::launch::async, [&locks] { locks.setLockFromCommand(0, true); });
  EXPECT_EQ(lockZero.wait_for(200ms), std::future_status::timeout);
  auto release = std::async(std::launch::async, [&locks] { locks.setLockFromCommand(3, false); });
  ASSERT_EQ(release.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(frozen.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(lockZero.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(table.snapshot().allReaderWriterState, -1);

  ASSERT_EQ(locks.setLockFromCommand(0, false), VSAResult::kSuccess);
  EXPECT_EQ(table.snapshot().allReaderWriterState, 0);

  // Lock 1 asked for behind an operation frozen at lock 4, then everything
  // turned off before it was had: the taker lets it go as soon as it has it.
  ASSERT_EQ(locks.setLockFromCommand(4, true), VSAResult::kSuccess);
  auto held = std::async(std::launch::async, [&locks, &table] {
    VSAIdentifierLockGuard guard(table, VSAValue("FROZEN-KEY"), true);
    locks.waitOnLock(4);
  });
  EXPECT_EQ(held.wait_for(200ms), std::future_status::timeout);
  auto lockOne = std::async(std::launch::async, [&locks] { locks.acquireLock(1); });
  EXPECT_EQ(lockOne.wait_for(200ms), std::future_status::timeout);
  auto off = std::async(std::launch::async, [&locks] { locks.setEnabled(false); });
  ASSERT_EQ(off.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(held.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(lockOne.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(locks.countForLock(1), 0);
  EXPECT_EQ(table.snapshot().allReaderWriterState, 0);
}

TEST(VSATestLocksDeathTest, AnUnbalancedReleaseEndsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        auto shared = std::make_shared<VSALocks>();
        [[maybe_unused]] VSALocks& table = *shared;
        VSATestLocks locks(shared);
        locks.acquireLock(4);
        locks.releaseLock(4);
        locks.releaseLock(4);
      },
      "Unbalanced update to test lock: 4 by: -1 from: 0");
}

}  // namespace
