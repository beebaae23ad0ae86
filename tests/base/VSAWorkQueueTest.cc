#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <mutex>
#include <thread>
#include <vector>

#include "base/VSAWorkQueue.h"

namespace {

using namespace std::chrono_literals;

TEST(VSAWorkQueue, SerialQueueRunsInSubmissionOrderOneAtATime) {
  auto q = VSAWorkQueue::create("test.serial");
  std::vector<int> order;
  std::atomic<int> inside{0};
  std::atomic<bool> overlap{false};
  for (int i = 0; i < 500; ++i) {
    q->async([&, i] {
      if (inside.fetch_add(1) != 0) overlap = true;
      order.push_back(i);
      inside.fetch_sub(1);
    });
  }
  q->sync([] {});
  ASSERT_EQ(order.size(), 500u);
  for (int i = 0; i < 500; ++i) EXPECT_EQ(order[i], i);
  EXPECT_FALSE(overlap);
}

TEST(VSAWorkQueue, TargetQueueSerialisesItsChildren) {
  auto parent = VSAWorkQueue::create("test.parent");
  auto a = VSAWorkQueue::create("test.child.a", VSAWorkQueue::Kind::Serial, parent);
  auto b = VSAWorkQueue::create("test.child.b", VSAWorkQueue::Kind::Serial, parent);
  std::atomic<int> inside{0};
  std::atomic<bool> overlap{false};
  std::atomic<bool> sawParentAsCurrent{true};
  auto work = [&](const VSAWorkQueue::Ref& self) {
    return [&, self] {
      if (inside.fetch_add(1) != 0) overlap = true;
      if (!parent->isCurrent() || !self->isCurrent()) sawParentAsCurrent = false;
      std::this_thread::sleep_for(50us);
      inside.fetch_sub(1);
    };
  };
  for (int i = 0; i < 200; ++i) {
    a->async(work(a));
    b->async(work(b));
    parent->async([&] {
      if (inside.fetch_add(1) != 0) overlap = true;
      inside.fetch_sub(1);
    });
  }
  a->sync([] {});
  b->sync([] {});
  parent->sync([] {});
  EXPECT_FALSE(overlap);
  EXPECT_TRUE(sawParentAsCurrent);
  EXPECT_FALSE(a->isCurrent());
}

TEST(VSAWorkQueue, ConcurrentQueueRunsInParallelAndBarrierExcludes) {
  auto q = VSAWorkQueue::create("test.concurrent", VSAWorkQueue::Kind::Concurrent);
  // Two blocks that each wait for the other can only finish if both run at once.
  std::promise<void> p1, p2;
  auto f1 = p1.get_future().share(), f2 = p2.get_future().share();
  std::atomic<int> done{0};
  q->async([&] {
    p1.set_value();
    if (f2.wait_for(5s) == std::future_status::ready) ++done;
  });
  q->async([&] {
    p2.set_value();
    if (f1.wait_for(5s) == std::future_status::ready) ++done;
  });
  std::atomic<int> running{0};
  std::atomic<bool> barrierSawOthers{false}, afterBarrierEarly{false};
  std::atomic<bool> barrierDone{false};
  for (int i = 0; i < 20; ++i)
    q->async([&] {
      ++running;
      std::this_thread::sleep_for(1ms);
      --running;
    });
  q->barrierAsync([&] {
    if (running.load() != 0 || done.load() != 2) barrierSawOthers = true;
    std::this_thread::sleep_for(5ms);
    barrierDone = true;
  });
  for (int i = 0; i < 20; ++i)
    q->async([&] {
      if (!barrierDone) afterBarrierEarly = true;
    });
  q->barrierSync([] {});
  EXPECT_EQ(done.load(), 2);
  EXPECT_FALSE(barrierSawOthers);
  EXPECT_FALSE(afterBarrierEarly);
}

TEST(VSAWorkQueue, SuspendIsCountedAndHoldsBackNewBlocks) {
  auto q = VSAWorkQueue::create("test.suspend");
  std::atomic<int> ran{0};
  q->suspend();
  q->suspend();
  q->async([&] { ++ran; });
  std::this_thread::sleep_for(20ms);
  EXPECT_EQ(ran.load(), 0);
  q->resume();
  std::this_thread::sleep_for(20ms);
  EXPECT_EQ(ran.load(), 0) << "one resume must not undo two suspends";
  EXPECT_EQ(q->suspendCount(), 1);
  EXPECT_EQ(q->depth(), 1u) << "the held block is waiting";
  q->resume();
  q->sync([] {});
  EXPECT_EQ(ran.load(), 1);
  EXPECT_EQ(q->suspendCount(), 0);
  EXPECT_EQ(q->depth(), 0u);
}

TEST(VSAWorkQueue, SuspendingATargetHoldsItsChildren) {
  auto parent = VSAWorkQueue::create("test.suspended.parent");
  auto child = VSAWorkQueue::create("test.suspended.child", VSAWorkQueue::Kind::Serial, parent);
  std::atomic<int> ran{0};
  parent->suspend();
  child->async([&] { ++ran; });
  std::this_thread::sleep_for(20ms);
  EXPECT_EQ(ran.load(), 0);
  parent->resume();
  child->sync([] {});
  EXPECT_EQ(ran.load(), 1);
}

TEST(VSAWorkQueueDeathTest, OverResumeAborts) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(VSAWorkQueue::create("test.overresume")->resume(), "over-resume");
}

TEST(VSAWorkQueue, MainQueueRunsOnlyInsideRunMain) {
  std::atomic<bool> ran{false};
  std::string label;
  VSAWorkQueue::main()->async([&] {
    ran = true;
    label = VSAWorkQueue::currentLabel();
    VSAWorkQueue::stopMain();
  });
  std::this_thread::sleep_for(10ms);
  EXPECT_FALSE(ran.load());
  VSAWorkQueue::runMain();
  EXPECT_TRUE(ran.load());
  EXPECT_EQ(label, "com.tamsk.vessad.main");
}

}  // namespace
