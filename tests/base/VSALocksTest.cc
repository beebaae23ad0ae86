#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <random>
#include <thread>
#include <vector>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAUUID.h"

namespace {

using namespace std::chrono_literals;

// The table the tests lock (a daemon's context owns one like it).
VSALocks table;

enum class Hold { IdRead, IdWrite, OtherRead, OtherWrite, AllRead, AllWrite };

void take(Hold h) {
  switch (h) {
    case Hold::IdRead:
      table.lock_identifier_read(VSAValue("A"));
      break;
    case Hold::IdWrite:
      table.lock_identifier_write(VSAValue("A"));
      break;
    case Hold::OtherRead:
      table.lock_identifier_read(VSAValue("B"));
      break;
    case Hold::OtherWrite:
      table.lock_identifier_write(VSAValue("B"));
      break;
    case Hold::AllRead:
      table.lock_all_identifiers_read();
      break;
    case Hold::AllWrite:
      table.lock_all_identifiers_write();
      break;
  }
}

void release(Hold h) {
  switch (h) {
    case Hold::IdRead:
    case Hold::IdWrite:
      table.unlock_identifier(VSAValue("A"));
      break;
    case Hold::OtherRead:
    case Hold::OtherWrite:
      table.unlock_identifier(VSAValue("B"));
      break;
    case Hold::AllRead:
    case Hold::AllWrite:
      table.unlock_all_identifiers();
      break;
  }
}

// Holds `held` on one thread and asks for `requested` on another: true when
// the request is granted while `held` is still held. Either way both are
// released in the end and the table is left empty.
bool grantedWhileHeld(Hold held, Hold requested) {
  std::promise<void> heldPromise, releasePromise;
  std::thread holder([&] {
    take(held);
    heldPromise.set_value();
    releasePromise.get_future().wait();
    release(held);
  });
  heldPromise.get_future().wait();
  std::atomic<bool> got{false};
  std::thread asker([&] {
    take(requested);
    got = true;
    release(requested);
  });
  for (int i = 0; i < 30 && !got; ++i) std::this_thread::sleep_for(5ms);
  bool granted = got;
  releasePromise.set_value();
  holder.join();
  asker.join();
  EXPECT_TRUE(got) << "the request must be granted once the hold ends";
  return granted;
}

TEST(VSALocks, CompatibilityTable) {
  struct Cell {
    Hold requested, held;
    bool granted;
  };
  const Cell cells[] = {
      {Hold::IdRead, Hold::IdRead, true},       {Hold::IdRead, Hold::IdWrite, false},
      {Hold::IdRead, Hold::OtherWrite, true},   {Hold::IdRead, Hold::AllRead, true},
      {Hold::IdRead, Hold::AllWrite, false},    {Hold::IdWrite, Hold::IdRead, false},
      {Hold::IdWrite, Hold::IdWrite, false},    {Hold::IdWrite, Hold::OtherWrite, true},
      {Hold::IdWrite, Hold::AllRead, false},    {Hold::IdWrite, Hold::AllWrite, false},
      {Hold::AllRead, Hold::IdRead, true},      {Hold::AllRead, Hold::IdWrite, false},
      {Hold::AllRead, Hold::OtherRead, true},   {Hold::AllRead, Hold::OtherWrite, false},
      {Hold::AllRead, Hold::AllRead, true},     {Hold::AllRead, Hold::AllWrite, false},
      {Hold::AllWrite, Hold::IdRead, false},    {Hold::AllWrite, Hold::IdWrite, false},
      {Hold::AllWrite, Hold::OtherRead, false}, {Hold::AllWrite, Hold::AllRead, false},
      {Hold::AllWrite, Hold::AllWrite, false},
  };
  for (const Cell& c : cells) {
    EXPECT_EQ(grantedWhileHeld(c.held, c.requested), c.granted)
        << "requested " << int(c.requested) << " while holding " << int(c.held);
  }
  VSALockTableState s = table.snapshot();
  EXPECT_EQ(s.recordCount, 0u);
  EXPECT_EQ(s.identifierReaderCount, 0u);
  EXPECT_EQ(s.identifierWriterCount, 0u);
  EXPECT_EQ(s.allReaderWriterState, 0);
}

TEST(VSALocks, ArraysAreTakenAscendingOnceAndReleasedDescending) {
  VSALogger::shared().setUseStderr(true);
  VSALogger::shared().setLevel(kVSALogDebug);
  testing::internal::CaptureStderr();
  {
    VSAIdentifierLockGuard guard(
        table, VSAValue(VSAValue::Array{VSAValue("B"), VSAValue("A"), VSAValue("B")}), true);
    EXPECT_EQ(table.snapshot().identifierWriterCount, 2u) << "duplicates are taken once";
  }
  std::string log = testing::internal::GetCapturedStderr();
  VSALogger::shared().setLevel(kVSALogNotice);
  size_t gotA = log.find("Got lock on identifier A"), gotB = log.find("Got lock on identifier B");
  size_t freeA = log.find("Unlocked identifier A"), freeB = log.find("Unlocked identifier B");
  ASSERT_NE(gotA, std::string::npos);
  ASSERT_NE(gotB, std::string::npos);
  EXPECT_LT(gotA, gotB);
  EXPECT_LT(freeB, freeA);
  EXPECT_NE(log.find("Destroying lock for identifier A"), std::string::npos);
  EXPECT_EQ(table.snapshot().recordCount, 0u) << "the map is empty after the last release";
}

TEST(VSALocks, OppositeOrderArraysFromManyThreadsNeverDeadlock) {
  std::atomic<bool> finished{false};
  std::thread watchdog([&] {
    for (int i = 0; i < 600 && !finished; ++i) std::this_thread::sleep_for(100ms);
    if (!finished) {
      std::fprintf(stderr, "deadlock: lock stress did not finish in 60 s\n");
      std::abort();
    }
  });
  const std::vector<std::string> keys = {"K1", "K2", "K3", "K4", "K5"};
  std::vector<std::thread> threads;
  std::atomic<long> critical{0};
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([&, t] {
      std::mt19937 rng(t);
      for (int i = 0; i < 2000; ++i) {
        VSAValue::Array arr;
        int n = 1 + rng() % 4;
        for (int k = 0; k < n; ++k) arr.push_back(VSAValue(keys[rng() % keys.size()]));
        if (t % 2) std::reverse(arr.begin(), arr.end());
        switch (rng() % 10) {
          case 0: {
            VSAAllIdentifiersLockGuard all(table, true);
            ++critical;
            break;
          }
          case 1: {
            VSAAllIdentifiersLockGuard all(table, false);
            VSAIdentifierLockGuard ids(table, VSAValue(arr), false);
            ++critical;
            break;
          }
          default: {
            VSAIdentifierLockGuard ids(table, VSAValue(arr), rng() % 2);
            ++critical;
          }
        }
      }
    });
  }
  for (auto& th : threads) th.join();
  finished = true;
  watchdog.join();
  EXPECT_EQ(critical.load(), 8 * 2000);
  EXPECT_EQ(table.snapshot().recordCount, 0u);
}

TEST(VSALocks, WaitingGlobalWriterDoesNotHoldBackIdentifierTraffic) {
  table.lock_identifier_read(VSAValue("A"));
  std::atomic<bool> writerIn{false};
  std::thread writer([&] {
    table.lock_all_identifiers_write();
    writerIn = true;
    table.unlock_all_identifiers();
  });
  std::this_thread::sleep_for(20ms);
  EXPECT_FALSE(writerIn);
  // New identifier readers and writers on other keys still get in at once.
  auto quick = [](std::function<void()> f) {
    auto fut = std::async(std::launch::async, f);
    return fut.wait_for(1s) == std::future_status::ready;
  };
  EXPECT_TRUE(quick([] { VSAIdentifierLockGuard g(table, VSAValue("B"), false); }));
  EXPECT_TRUE(quick([] { VSAIdentifierLockGuard g(table, VSAValue("C"), true); }));
  EXPECT_FALSE(writerIn);
  table.unlock_identifier(VSAValue("A"));
  writer.join();
  EXPECT_TRUE(writerIn);
}

// Readers and writers crowding one key: most requests find the key's lock
// free or shared and take it at once, the rest wait for it. Either way a
// writer is alone and readers overlap only with readers.
TEST(VSALocks, OneKeyUnderMixedTrafficKeepsWritersAlone) {
  std::atomic<int> readers{0}, writers{0}, violations{0};
  std::atomic<long> writes{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 6; ++t) {
    threads.emplace_back([&, t] {
      std::mt19937 rng(t + 100);
      for (int i = 0; i < 3000; ++i) {
        bool writing = rng() % 4 == 0;
        VSAIdentifierLockGuard g(table, VSAValue("K"), writing);
        if (writing) {
          if (writers.fetch_add(1) != 0 || readers.load() != 0) ++violations;
          ++writes;
          if (i % 64 == 0) std::this_thread::yield();
          writers.fetch_sub(1);
        } else {
          if (writers.load() != 0) ++violations;
          readers.fetch_add(1);
          if (i % 32 == 0) std::this_thread::yield();
          readers.fetch_sub(1);
        }
      }
    });
  }
  for (auto& th : threads) th.join();
  EXPECT_EQ(violations.load(), 0);
  EXPECT_GT(writes.load(), 0);
  VSALockTableState s = table.snapshot();
  EXPECT_EQ(s.recordCount, 0u);
  EXPECT_EQ(s.identifierReaderCount, 0u);
  EXPECT_EQ(s.identifierWriterCount, 0u);
}

TEST(VSALocks, GuardsWithoutLockingTakeNothing) {
  {
    VSAAllIdentifiersLockGuard all(table, true, false);
    VSAIdentifierLockGuard ids(table, VSAValue("A"), true, false);
    EXPECT_EQ(table.snapshot().recordCount, 0u);
    EXPECT_EQ(table.snapshot().allReaderWriterState, 0);
  }
  EXPECT_EQ(table.snapshot().allReaderWriterState, 0);
}

// Each daemon instance has its own table: what one holds never stops the
// other, even for the same key, and each counts only its own holders.
TEST(VSALocks, TwoTablesNeverShareALock) {
  VSALocks other;
  auto takeInOther = [&other](bool all) {
    return std::async(std::launch::async, [&other, all] {
      VSAAllIdentifiersLockGuard everything(other, true, all);
      VSAIdentifierLockGuard key(other, VSAValue("SHARED-KEY"), true, !all);
      return other.snapshot();
    });
  };
  // One table's writer of a key does not hold up the other's writer of that key...
  table.lock_identifier_write(VSAValue("SHARED-KEY"));
  auto keyWriter = takeInOther(false);
  ASSERT_EQ(keyWriter.wait_for(5s), std::future_status::ready) << "a key lock crossed tables";
  EXPECT_EQ(keyWriter.get().identifierWriterCount, 1u);
  table.unlock_identifier(VSAValue("SHARED-KEY"));
  // ...and its all-identifiers writer does not hold up the other's.
  table.lock_all_identifiers_write();
  auto allWriter = takeInOther(true);
  ASSERT_EQ(allWriter.wait_for(5s), std::future_status::ready) << "the global lock crossed tables";
  EXPECT_EQ(allWriter.get().allReaderWriterState, -1);
  EXPECT_EQ(table.snapshot().allReaderWriterState, -1);
  table.unlock_all_identifiers();
  EXPECT_EQ(other.snapshot().recordCount, 0u);
  EXPECT_EQ(table.snapshot().recordCount, 0u);
}

TEST(VSALocksDeathTest, NonStringKeyAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(table.lock_identifier_read(VSAValue(42)), "Unknown parameter type!");
  EXPECT_DEATH(table.lock_identifier_write(VSAValue(VSAValue::Array{VSAValue("A"), VSAValue(1)})),
               "Unknown parameter type!");
  EXPECT_DEATH(table.unlock_identifier(VSAValue(VSAValue::Dictionary{})),
               "Unknown parameter type!");
}

TEST(VSALocksDeathTest, UnbalancedUnlockAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(table.unlock_identifier(VSAValue("never-locked")), "Assertion failed");
  EXPECT_DEATH(table.unlock_all_identifiers(), "Assertion failed: t.allReaderWriterState > 0");
}

}  // namespace

namespace {

// Many keys in use at once, released in a scrambled order: every remaining
// key must still be found (a lost record would let a second writer in).
TEST(VSALocks, ManyKeysSurviveGrowthAndScrambledRelease) {
  std::vector<std::string> keys;
  for (int i = 0; i < 60; ++i) keys.push_back(VSAUUID::random().string());
  VSAValue::Array all;
  for (auto& k : keys) all.push_back(VSAValue(k));
  table.lock_identifier_write(VSAValue(all));
  EXPECT_EQ(table.snapshot().recordCount, 60u);
  std::mt19937 rng(7);
  std::shuffle(keys.begin(), keys.end(), rng);
  for (size_t i = 0; i < keys.size(); ++i) {
    table.unlock_identifier(VSAValue(keys[i]));
    if (i % 7 == 0 && i + 1 < keys.size()) {
      // A key still held must still exclude a writer.
      VSAValue next(keys[i + 1]);
      auto fut =
          std::async(std::launch::async, [next] { VSAIdentifierLockGuard g(table, next, true); });
      EXPECT_EQ(fut.wait_for(30ms), std::future_status::timeout) << i;
      table.unlock_identifier(VSAValue(keys[i + 1]));
      fut.get();
      table.lock_identifier_write(VSAValue(keys[i + 1]));
    }
  }
  EXPECT_EQ(table.snapshot().recordCount, 0u);
  EXPECT_EQ(table.snapshot().identifierWriterCount, 0u);
}

// Released keys keep their records for the next use, a bounded number of
// them; a key whose record was kept, or destroyed, must lock as before.
TEST(VSALocks, KeptRecordsAreBoundedAndStillExclude) {
  std::vector<std::string> keys;
  for (int i = 0; i < 200; ++i) keys.push_back(VSAUUID::random().string());
  for (auto& k : keys) {
    table.lock_identifier_read(VSAValue(k));
    table.unlock_identifier(VSAValue(k));
  }
  VSALockTableState s = table.snapshot();
  EXPECT_EQ(s.recordCount, 0u);
  EXPECT_GT(s.idleRecords, 0u);
  EXPECT_LE(s.idleRecords, 64u);
  // keys[0] was destroyed long ago, keys[199] is kept: both exclude a writer
  // while a reader holds them, and both let it in afterwards.
  for (const std::string& k : {keys.front(), keys.back()}) {
    VSAValue key(k);
    table.lock_identifier_read(key);
    EXPECT_EQ(table.snapshot().recordCount, 1u);
    auto fut =
        std::async(std::launch::async, [key] { VSAIdentifierLockGuard g(table, key, true); });
    EXPECT_EQ(fut.wait_for(30ms), std::future_status::timeout) << k;
    table.unlock_identifier(key);
    fut.get();
  }
  s = table.snapshot();
  EXPECT_EQ(s.recordCount, 0u);
  EXPECT_EQ(s.identifierReaderCount + s.identifierWriterCount, 0u);
  EXPECT_LE(s.idleRecords, 64u);
}

}  // namespace
