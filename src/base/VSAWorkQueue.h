// Work queues: the daemon's only concurrency primitive besides the lock table.
//
// Ordering guarantees:
//  - A serial queue runs its blocks one at a time, in submission order.
//  - A concurrent queue may run its blocks in parallel; a barrier block waits
//    for every block submitted before it and holds back every block
//    submitted after it until it has finished.
//  - A queue with a target queue runs its blocks *on* the target: a serial
//    target therefore never runs at the same time as any queue that targets
//    it, and queues that share a serial target are serialised with each other.
//  - suspend()/resume() are counted; a suspended queue starts no new block
//    (a running block finishes). Resuming more often than suspending is a
//    programming error and aborts.
//  - sync() runs the block and waits for it (on an idle serial queue that
//    runs on the shared pool, the calling thread runs it itself); calling sync() on a serial queue
//    from a block already running on it (or on a queue it targets) deadlocks,
//    exactly like the platform's queues. isCurrent() lets `_onQueue_` methods
//    assert where they run.
//  - runIfIdle() runs a block on the calling thread when the queue could
//    start it at once: a serial queue, not suspended, with nothing queued or
//    running, whose serial targets (up to the shared pool) are idle too. The
//    block is then ordered exactly as if it had been submitted and run at
//    once; blocks submitted meanwhile wait for it. Otherwise it returns false
//    and runs nothing.
// Blocks run on a shared, growing thread pool (default or background
// priority) or, for the main queue, on the thread that calls runMain().
#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

class VSAWorkQueueExecutor;

class VSAWorkQueue : public std::enable_shared_from_this<VSAWorkQueue> {
 public:
  using Block = std::function<void()>;
  using Ref = std::shared_ptr<VSAWorkQueue>;
  enum class Kind { Serial, Concurrent };
  enum class Priority { Default, Background };

  // A new queue; without a target it runs on the default-priority pool.
  static Ref create(std::string label, Kind kind = Kind::Serial, Ref target = nullptr);
  // The process-wide concurrent queues of each priority.
  static Ref global(Priority priority = Priority::Default);
  // The main queue: its blocks run only inside runMain().
  static Ref main();
  // Runs main-queue blocks on the calling thread until stopMain() is called.
  static void runMain();
  static void stopMain();
  // Label of the innermost queue running on this thread ("" when none).
  static std::string currentLabel();

  ~VSAWorkQueue();

  void async(Block block);
  void sync(Block block);
  // Runs `block` here and now when the queue is idle (see above); false otherwise.
  bool runIfIdle(const Block& block);
  // Barriers on a concurrent queue; on a serial queue they are plain blocks.
  void barrierAsync(Block block);
  void barrierSync(Block block);

  void suspend();
  void resume();
  int suspendCount() const;
  // Blocks submitted and not yet started (a running block is not counted).
  size_t depth() const;

  // Changes the target; only meaningful before the first block is submitted.
  void setTarget(Ref target);
  bool isCurrent() const;
  const std::string& label() const { return label_; }
  Kind kind() const { return kind_; }

  VSAWorkQueue(std::string label, Kind kind, Ref target, VSAWorkQueueExecutor* executor);

 private:
  struct Item {
    Block block;
    bool barrier;
  };
  void enqueue(Item item);
  void submitToTarget(Block job);
  void submitDrain();
  void drainSerial();
  void pumpConcurrent();
  void runItem(const Block& block);
  // Marks this queue and its serial targets as draining when all are idle;
  // appends them, innermost first, to `claimed`. False (nothing claimed) otherwise.
  bool claimIdleChain(std::vector<VSAWorkQueue*>& claimed);
  // Lets go of queues claimed by claimIdleChain and drains what arrived meanwhile.
  static void releaseClaimed(const std::vector<VSAWorkQueue*>& claimed);

  std::string label_;
  Kind kind_;
  Ref target_;
  VSAWorkQueueExecutor* executor_;  // set only on root queues (no target)
  mutable std::mutex mutex_;
  std::deque<Item> items_;
  int suspendCount_ = 0;
  bool drainScheduled_ = false;  // serial
  int running_ = 0;              // concurrent
  bool barrierRunning_ = false;  // concurrent
};

// The check of every `_onQueue_` method, kept in release builds: a call from
// the wrong queue is a logic error, logged at fault level (the caller goes
// on, as after any fault). Answers whether the caller was on `queue`.
bool VSACheckOnQueue(const VSAWorkQueue& queue, const char* function);
