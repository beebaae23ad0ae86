#include <gtest/gtest.h>

#include <vector>

#include "daemon/VSALockStateMonitor.h"

namespace {

struct Sequence {
  std::vector<int> states;
  size_t next = 0;
  int operator()() { return states[next++]; }
};

int countAfter(VSALockStateMonitor& m, const VSAWorkQueue::Ref& q, std::vector<int> states,
               Sequence& seq) {
  seq.states.insert(seq.states.end(), states.begin(), states.end());
  for (size_t i = 0; i < states.size(); ++i) m.lockStateDidChange();
  return q->suspendCount();
}

TEST(VSALockStateMonitor, LockedLockedUnlockedSuspendsAndResumesOnce) {
  auto q = VSAWorkQueue::create("test.lockstate");
  auto seq = std::make_shared<Sequence>();
  VSALockStateMonitor m(q, [seq] { return (*seq)(); });
  EXPECT_EQ(m.recordedState(), 3u);
  EXPECT_EQ(countAfter(m, q, {1}, *seq), 1);
  EXPECT_EQ(countAfter(m, q, {1}, *seq), 1) << "a second lock must not suspend again";
  EXPECT_EQ(countAfter(m, q, {0}, *seq), 0);
  EXPECT_EQ(m.recordedState(), 0u);
  bool ran = false;
  q->sync([&] { ran = true; });
  EXPECT_TRUE(ran);
}

TEST(VSALockStateMonitor, UnlockWithoutSuspensionAndUnknownStatesChangeNothing) {
  auto q = VSAWorkQueue::create("test.lockstate.unknown");
  auto seq = std::make_shared<Sequence>();
  VSALockStateMonitor m(q, [seq] { return (*seq)(); });
  EXPECT_EQ(countAfter(m, q, {0}, *seq), 0) << "no resume of a queue never suspended";
  EXPECT_EQ(countAfter(m, q, {2, -1}, *seq), 0);
  EXPECT_EQ(m.recordedState(), 0u);
  EXPECT_EQ(countAfter(m, q, {1, 7}, *seq), 1);
  EXPECT_EQ(m.recordedState(), 1u) << "an unknown state keeps the recorded one";
  EXPECT_EQ(countAfter(m, q, {0}, *seq), 0);
}

}  // namespace
