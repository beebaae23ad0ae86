// Progress of long work: lines at a bounded rate, the list of work under
// way that the state dump reads, and sizes for people.
#include <gtest/gtest.h>

#include <thread>

#include "base/VSAProgressLog.h"

namespace {
using namespace std::chrono_literals;

struct ProgressInterval {
  explicit ProgressInterval(std::chrono::milliseconds ms) { VSAProgressLog::setInterval(ms); }
  ~ProgressInterval() { VSAProgressLog::setInterval(2000ms); }
};

bool listed(const std::string& task) {
  for (const auto& s : VSAProgressLog::active())
    if (s.task == task) return true;
  return false;
}

TEST(ProgressLog, WorkIsListedWhileItRunsWithItsCounts) {
  ProgressInterval interval(0ms);
  {
    VSAProgressLog progress(VSALogCategory::Test, "test", "Test work", 10, "entries");
    progress.advance(3, 1000);
    progress.addBytes(24);
    progress.setTotal(12);
    EXPECT_TRUE(progress.shown()) << "with no interval every step logs";
    bool found = false;
    for (const auto& s : VSAProgressLog::active())
      if (s.task == "Test work") {
        found = true;
        EXPECT_EQ(s.done, 3u);
        EXPECT_EQ(s.total, 12u);
        EXPECT_EQ(s.bytes, 1024u);
        EXPECT_EQ(s.unit, "entries");
      }
    EXPECT_TRUE(found);
  }
  EXPECT_FALSE(listed("Test work")) << "finished work leaves the list";
}

TEST(ProgressLog, ShortWorkWritesNoLineAndLongWorkDoes) {
  ProgressInterval interval(50ms);
  VSAProgressLog quick(VSALogCategory::Test, "test", "Quick work", 100);
  for (int i = 0; i < 100; ++i) quick.advance();
  EXPECT_FALSE(quick.shown()) << "work shorter than the interval stays quiet";
  VSAProgressLog slow(VSALogCategory::Test, "test", "Slow work", 2);
  slow.advance();
  std::this_thread::sleep_for(60ms);
  slow.advance();
  EXPECT_TRUE(slow.shown());
}

TEST(ProgressLog, ListIsSafeToReadWhileWorkAdvances) {
  ProgressInterval interval(0ms);
  std::atomic<bool> stop{false};
  std::thread reader([&] {
    while (!stop) VSAProgressLog::active();
  });
  for (int round = 0; round < 200; ++round) {
    VSAProgressLog progress(VSALogCategory::Test, "test", "Racing work", 5);
    for (int i = 0; i < 5; ++i) progress.advance(1, 10);
  }
  stop = true;
  reader.join();
  EXPECT_FALSE(listed("Racing work"));
}

TEST(ProgressLog, ByteCountsReadLikeSizes) {
  EXPECT_EQ(VSAProgressLog::byteCount(0), "0 bytes");
  EXPECT_EQ(VSAProgressLog::byteCount(1023), "1023 bytes");
  EXPECT_EQ(VSAProgressLog::byteCount(1536), "1.5 KB");
  EXPECT_EQ(VSAProgressLog::byteCount(10ull << 20), "10 MB");
  EXPECT_EQ(VSAProgressLog::byteCount(3ull << 40), "3.0 TB");
  EXPECT_EQ(VSAProgressLog::byteCount(UINT64_MAX), "16384 PB");
}
}  // namespace
