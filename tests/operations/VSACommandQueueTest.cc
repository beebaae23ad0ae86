#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <thread>
#include <vector>

#include "base/VSACommands.h"
#include "operations/VSACommandQueue.h"

namespace {

class Recorder : public VSACommand {
 public:
  Recorder(std::vector<int>& log, int id, VSAResultCode code = 1,
           std::function<void(VSACommandQueue&)> extra = {})
      : log_(log), id_(id), code_(code), extra_(std::move(extra)) {}
  VSACommandNumber command() const override { return VSACommands::kStageForDelete; }
  bool fromQueue(VSACommandQueue& queue, VSAResultCode* error) override {
    log_.push_back(id_);
    if (extra_) extra_(queue);
    if (code_ != 1) *error = code_;
    return code_ == 1;
  }

 private:
  std::vector<int>& log_;
  int id_;
  VSAResultCode code_;
  std::function<void(VSACommandQueue&)> extra_;
};

TEST(VSACommandQueue, EmptyDrainLeavesTheCellAlone) {
  VSACommandQueue q;
  VSAResultCode cell = 55;
  EXPECT_TRUE(q.executeAllUntilExhaustedOrError(&cell));
  EXPECT_EQ(cell, 55u);
  EXPECT_FALSE(q.executeNextCommandWithError(&cell));
  EXPECT_EQ(cell, 77u);
}

TEST(VSACommandQueue, FailingSecondCommandStopsTheThird) {
  VSACommandQueue q;
  std::vector<int> log;
  q.insertCommand(std::make_shared<Recorder>(log, 1));
  q.insertCommand(std::make_shared<Recorder>(log, 2, 41));
  q.insertCommand(std::make_shared<Recorder>(log, 3));
  VSAResultCode cell = 1;
  EXPECT_FALSE(q.executeAllUntilExhaustedOrError(&cell));
  EXPECT_EQ(cell, 41u);
  EXPECT_EQ(log, (std::vector<int>{1, 2}));
  EXPECT_EQ(q.count(), 1u);
}

TEST(VSACommandQueue, CommandsInsertedDuringExecutionRunInTheSameDrain) {
  VSACommandQueue q;
  std::vector<int> log;
  q.insertCommand(std::make_shared<Recorder>(log, 1, 1, [&log](VSACommandQueue& queue) {
    queue.insertCommand(std::make_shared<Recorder>(log, 4));
  }));
  q.insertCommand(std::make_shared<Recorder>(log, 2));
  q.insertCommand(std::make_shared<Recorder>(log, 3));
  VSAResultCode cell = 1;
  EXPECT_TRUE(q.executeAllUntilExhaustedOrError(&cell));
  EXPECT_EQ(cell, 1u);
  EXPECT_EQ(log, (std::vector<int>{1, 2, 3, 4}));
}

TEST(VSACommandQueue, InsertionFromManyThreadsLosesNothing) {
  VSACommandQueue q;
  std::vector<int> log;
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t)
    threads.emplace_back([&, t] {
      for (int i = 0; i < 100; ++i) q.insertCommand(std::make_shared<Recorder>(log, t * 100 + i));
    });
  for (auto& th : threads) th.join();
  VSAResultCode cell = 1;
  EXPECT_TRUE(q.executeAllUntilExhaustedOrError(&cell));
  EXPECT_EQ(log.size(), 800u);
}

}  // namespace
