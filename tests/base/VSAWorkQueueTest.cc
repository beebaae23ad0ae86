#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <future>
#include <mutex>
#include <string>
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

TEST(VSAWorkQueue, RunIfIdleRunsHereOnlyWhenTheWholeChainCouldStartIt) {
  auto parent = VSAWorkQueue::create("test.inline.parent");
  auto child = VSAWorkQueue::create("test.inline.child", VSAWorkQueue::Kind::Serial, parent);
  std::thread::id ranOn;
  bool bothCurrent = false;
  std::string label;
  ASSERT_TRUE(child->runIfIdle([&] {
    ranOn = std::this_thread::get_id();
    bothCurrent = child->isCurrent() && parent->isCurrent();
    label = VSAWorkQueue::currentLabel();
  }));
  EXPECT_EQ(ranOn, std::this_thread::get_id());
  EXPECT_TRUE(bothCurrent);
  EXPECT_EQ(label, "test.inline.child");
  EXPECT_FALSE(child->isCurrent() || parent->isCurrent());

  // A busy target refuses, and the child it had claimed is left usable.
  std::promise<void> release;
  std::promise<void> started;
  parent->async([&, gate = release.get_future().share()] {
    started.set_value();
    gate.wait();
  });
  started.get_future().wait();
  bool ran = false;
  EXPECT_FALSE(child->runIfIdle([&] { ran = true; }));
  EXPECT_FALSE(parent->runIfIdle([&] { ran = true; }));
  std::atomic<bool> later{false};
  child->async([&] { later = true; });
  release.set_value();
  child->sync([] {});
  EXPECT_TRUE(later.load());
  EXPECT_FALSE(ran);

  child->suspend();
  EXPECT_FALSE(child->runIfIdle([&] { ran = true; }));
  child->resume();
  EXPECT_FALSE(VSAWorkQueue::create("test.inline.concurrent", VSAWorkQueue::Kind::Concurrent)
                   ->runIfIdle([&] { ran = true; }));
  EXPECT_FALSE(VSAWorkQueue::main()->runIfIdle([&] { ran = true; }));
  EXPECT_FALSE(ran);
}

TEST(VSAWorkQueue, BlocksSubmittedDuringAnInlineRunWaitForIt) {
  auto parent = VSAWorkQueue::create("test.inline.parent");
  auto child = VSAWorkQueue::create("test.inline.child", VSAWorkQueue::Kind::Serial, parent);
  std::mutex mutex;
  std::vector<std::string> order;
  auto note = [&](const char* what) {
    std::lock_guard lock(mutex);
    order.push_back(what);
  };
  ASSERT_TRUE(child->runIfIdle([&] {
    child->async([&] { note("child 1"); });
    parent->async([&] { note("parent"); });
    child->async([&] { note("child 2"); });
    std::this_thread::sleep_for(30ms);  // time enough for a pool thread to take them, wrongly
    note("inline");
  }));
  child->sync([] {});
  parent->sync([] {});
  ASSERT_EQ(order.size(), 4u);
  EXPECT_EQ(order[0], "inline");
  auto at = [&](const char* what) { return std::find(order.begin(), order.end(), what); };
  EXPECT_LT(at("child 1"), at("child 2"));
}

// One submitter that tries inline first and falls back to async, racing with
// other submitters: its blocks run in its order, and never two at once.
TEST(VSAWorkQueue, InlineAndQueuedBlocksOfOneSubmitterKeepTheirOrder) {
  auto parent = VSAWorkQueue::create("test.inline.parent");
  auto q = VSAWorkQueue::create("test.inline.mixed", VSAWorkQueue::Kind::Serial, parent);
  std::atomic<int> inside{0};
  std::atomic<bool> overlap{false};
  std::vector<int> order;
  std::atomic<int> inlined{0};
  auto body = [&](int i) {
    return [&, i] {
      if (inside.fetch_add(1) != 0) overlap = true;
      order.push_back(i);
      inside.fetch_sub(1);
    };
  };
  std::atomic<bool> done{false};
  std::thread noise([&] {
    while (!done) {
      parent->async([&] {
        if (inside.fetch_add(1) != 0) overlap = true;
        inside.fetch_sub(1);
      });
      std::this_thread::sleep_for(20us);
    }
  });
  for (int i = 0; i < 5000; ++i) {
    VSAWorkQueue::Block block = body(i);
    if (q->runIfIdle(block)) {
      ++inlined;
    } else {
      q->async(std::move(block));
    }
    // Now and then the queue drains, so that both paths are taken however
    // slow the pool is (a submitter faster than it would never find it idle).
    if (i % 100 == 99) q->sync([] {});
  }
  done = true;
  noise.join();
  q->sync([] {});
  parent->sync([] {});
  ASSERT_EQ(order.size(), 5000u);
  for (int i = 0; i < 5000; ++i) ASSERT_EQ(order[i], i);
  EXPECT_FALSE(overlap);
  EXPECT_GT(inlined.load(), 0);
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
