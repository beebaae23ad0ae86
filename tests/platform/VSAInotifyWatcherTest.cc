#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <future>
#include <memory>
#include <thread>

#include "VSATestTempDir.h"
#include "platform/VSAInotifyWatcher.h"

namespace {

using namespace std::chrono_literals;

template <typename Predicate>
bool eventually(Predicate p) {
  for (int i = 0; i < 400 && !p(); ++i) std::this_thread::sleep_for(5ms);
  return p();
}

TEST(VSAInotifyWatcher, ReportsOnlyWatchedNames) {
  VSATestTempDir temp("vessa-inotify");
  auto queue = VSAWorkQueue::create("test.inotify.names");
  auto seen = std::make_shared<std::atomic<int>>(0);
  auto other = std::make_shared<std::atomic<int>>(0);
  VSAInotifyWatcher watcher(temp.path(), {"watched"}, queue, [seen, other](const std::string& n) {
    ++*(n == "watched" ? seen : other);
  });
  VSAErrorRef error;
  ASSERT_TRUE(watcher.start(&error));
  std::ofstream(temp.path() + "/ignored") << "x";
  std::ofstream(temp.path() + "/watched") << "x";
  EXPECT_TRUE(eventually([&] { return *seen > 0; }));
  queue->sync([] {});
  EXPECT_EQ(other->load(), 0);
  VSAInotifyWatcher missing(temp.path() + "/none", {"x"}, queue, [](const std::string&) {});
  EXPECT_FALSE(missing.start(&error)) << "the directory must exist";
}

// Destroying a watcher waits for its running handler and turns away the
// calls still queued behind it, so a handler never outlives what it uses.
TEST(VSAInotifyWatcher, NoHandlerRunsAfterTheDestructorReturns) {
  VSATestTempDir temp("vessa-inotify");
  auto queue = VSAWorkQueue::create("test.inotify.teardown");
  auto calls = std::make_shared<std::atomic<int>>(0);
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  auto watcher = std::make_unique<VSAInotifyWatcher>(temp.path(), std::set<std::string>{"f"}, queue,
                                                     [calls, released](const std::string&) {
                                                       if (++*calls == 1) released.wait();
                                                     });
  VSAErrorRef error;
  ASSERT_TRUE(watcher->start(&error));
  std::ofstream(temp.path() + "/f") << "1";
  ASSERT_TRUE(eventually([&] { return *calls == 1; })) << "the first handler is running";
  std::ofstream(temp.path() + "/f") << "2";
  std::this_thread::sleep_for(100ms);  // lets the second change reach the queue
  std::atomic<bool> destroyed{false};
  std::thread destroyer([&] {
    watcher.reset();
    destroyed = true;
  });
  std::this_thread::sleep_for(100ms);
  EXPECT_FALSE(destroyed) << "the destructor waits for the running handler";
  release.set_value();
  destroyer.join();
  queue->sync([] {});
  EXPECT_EQ(calls->load(), 1) << "the queued call was turned away";
}

TEST(VSAInotifyWatcher, AHandlerMayDestroyItsOwnWatcher) {
  VSATestTempDir temp("vessa-inotify");
  auto queue = VSAWorkQueue::create("test.inotify.self");
  auto holder = std::make_shared<std::unique_ptr<VSAInotifyWatcher>>();
  auto done = std::make_shared<std::atomic<bool>>(false);
  *holder = std::make_unique<VSAInotifyWatcher>(temp.path(), std::set<std::string>{"f"}, queue,
                                                [holder, done](const std::string&) {
                                                  holder->reset();
                                                  *done = true;
                                                });
  VSAErrorRef error;
  ASSERT_TRUE((*holder)->start(&error));
  std::ofstream(temp.path() + "/f") << "1";
  EXPECT_TRUE(eventually([&] { return done->load(); }));
  queue->sync([] {});
  EXPECT_FALSE(*holder);
  holder->reset();
}

}  // namespace
