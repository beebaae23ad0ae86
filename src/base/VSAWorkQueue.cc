#include "base/VSAWorkQueue.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <thread>
#include <vector>

#include "base/VSALog.h"

// Where root queues hand their work: a thread pool or the main loop.
class VSAWorkQueueExecutor {
 public:
  virtual ~VSAWorkQueueExecutor() = default;
  virtual void submit(std::function<void()> job) = 0;
};

namespace {

constexpr int kSerialBatch = 16;  // blocks per drain before yielding the target

thread_local std::vector<const VSAWorkQueue*> tCurrentQueues;

struct CurrentQueueScope {
  explicit CurrentQueueScope(const VSAWorkQueue* q) { tCurrentQueues.push_back(q); }
  ~CurrentQueueScope() { tCurrentQueues.pop_back(); }
};

// Several queues current at once, given innermost first; the outermost is
// pushed first, as nested drains would push them.
struct CurrentQueueChainScope {
  explicit CurrentQueueChainScope(const std::vector<VSAWorkQueue*>& innermostFirst)
      : count(innermostFirst.size()) {
    for (auto it = innermostFirst.rbegin(); it != innermostFirst.rend(); ++it)
      tCurrentQueues.push_back(*it);
  }
  ~CurrentQueueChainScope() { tCurrentQueues.resize(tCurrentQueues.size() - count); }
  size_t count;
};

// A pool that grows whenever every thread is busy, so that a block that waits
// for another block can never starve it; idle threads retire after a while.
class ThreadPool final : public VSAWorkQueueExecutor {
 public:
  ThreadPool(const char* name, int nice) : name_(name), nice_(nice) {}

  void submit(std::function<void()> job) override {
    std::unique_lock lock(mutex_);
    jobs_.push_back(std::move(job));
    if (jobs_.size() > static_cast<size_t>(idle_)) {
      ++threads_;
      std::thread([this] { worker(); }).detach();
      return;
    }
    // Woken after the unlock: a thread woken while the lock is still held
    // would only block on it again (one more switch on every hand-off).
    lock.unlock();
    cv_.notify_one();
  }

 private:
  void worker() {
    pthread_setname_np(pthread_self(), name_);
    if (nice_) setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), nice_);
    std::unique_lock lock(mutex_);
    for (;;) {
      while (jobs_.empty()) {
        ++idle_;
        bool woke = cv_.wait_for(lock, std::chrono::seconds(20), [this] { return !jobs_.empty(); });
        --idle_;
        if (!woke) {
          --threads_;
          return;
        }
      }
      auto job = std::move(jobs_.front());
      jobs_.pop_front();
      lock.unlock();
      job();
      job = nullptr;
      lock.lock();
    }
  }

  const char* name_;
  int nice_;
  std::mutex mutex_;
  std::condition_variable cv_;
  std::deque<std::function<void()>> jobs_;
  int idle_ = 0;
  int threads_ = 0;
};

class MainLoop final : public VSAWorkQueueExecutor {
 public:
  void submit(std::function<void()> job) override {
    std::lock_guard lock(mutex_);
    jobs_.push_back(std::move(job));
    cv_.notify_one();
  }
  // A stop asked for before run() starts ends the next run at once.
  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      cv_.wait(lock, [this] { return stop_ || !jobs_.empty(); });
      if (stop_) {
        stop_ = false;
        return;
      }
      auto job = std::move(jobs_.front());
      jobs_.pop_front();
      lock.unlock();
      job();
      lock.lock();
    }
  }
  void stop() {
    std::lock_guard lock(mutex_);
    stop_ = true;
    cv_.notify_all();
  }

 private:
  std::mutex mutex_;
  std::condition_variable cv_;
  std::deque<std::function<void()>> jobs_;
  bool stop_ = false;
};

// Leaked on purpose: worker threads may outlive static destruction.
ThreadPool& defaultPool() {
  static auto* pool = new ThreadPool("vessa-worker", 0);
  return *pool;
}
ThreadPool& backgroundPool() {
  static auto* pool = new ThreadPool("vessa-bg-worker", 10);
  return *pool;
}
MainLoop& mainLoop() {
  static auto* loop = new MainLoop();
  return *loop;
}

}  // namespace

VSAWorkQueue::VSAWorkQueue(std::string label, Kind kind, Ref target, VSAWorkQueueExecutor* executor)
    : label_(std::move(label)), kind_(kind), target_(std::move(target)), executor_(executor) {}

VSAWorkQueue::~VSAWorkQueue() = default;

VSAWorkQueue::Ref VSAWorkQueue::create(std::string label, Kind kind, Ref target) {
  if (!target) target = global(Priority::Default);
  return std::make_shared<VSAWorkQueue>(std::move(label), kind, std::move(target), nullptr);
}

VSAWorkQueue::Ref VSAWorkQueue::global(Priority priority) {
  static auto* def = new Ref(std::make_shared<VSAWorkQueue>(
      "com.tamsk.vessad.global.default", Kind::Concurrent, nullptr, &defaultPool()));
  static auto* bg = new Ref(std::make_shared<VSAWorkQueue>(
      "com.tamsk.vessad.global.background", Kind::Concurrent, nullptr, &backgroundPool()));
  return priority == Priority::Background ? *bg : *def;
}

VSAWorkQueue::Ref VSAWorkQueue::main() {
  static auto* q = new Ref(
      std::make_shared<VSAWorkQueue>("com.tamsk.vessad.main", Kind::Serial, nullptr, &mainLoop()));
  return *q;
}

void VSAWorkQueue::runMain() { mainLoop().run(); }
void VSAWorkQueue::stopMain() { mainLoop().stop(); }

std::string VSAWorkQueue::currentLabel() {
  return tCurrentQueues.empty() ? std::string() : tCurrentQueues.back()->label();
}

bool VSAWorkQueue::isCurrent() const {
  return std::find(tCurrentQueues.begin(), tCurrentQueues.end(), this) != tCurrentQueues.end();
}

void VSAWorkQueue::setTarget(Ref target) {
  std::lock_guard lock(mutex_);
  if (!executor_) target_ = target ? std::move(target) : global(Priority::Default);
}

void VSAWorkQueue::async(Block block) { enqueue(Item{std::move(block), false}); }

void VSAWorkQueue::barrierAsync(Block block) {
  enqueue(Item{std::move(block), kind_ == Kind::Concurrent});
}

namespace {
void runAndWait(const std::function<void(VSAWorkQueue::Block)>& submit, VSAWorkQueue::Block block) {
  std::mutex m;
  std::condition_variable cv;
  bool done = false;
  submit([&] {
    block();
    std::lock_guard lock(m);
    done = true;
    cv.notify_one();
  });
  std::unique_lock lock(m);
  cv.wait(lock, [&] { return done; });
}
}  // namespace

void VSAWorkQueue::sync(Block block) {
  // An idle serial queue is taken over by the calling thread for the block,
  // which saves two thread switches.
  if (runIfIdle(block)) return;
  runAndWait([this](Block b) { async(std::move(b)); }, std::move(block));
}

bool VSAWorkQueue::claimIdleChain(std::vector<VSAWorkQueue*>& claimed) {
  for (VSAWorkQueue* q = this;; q = q->target_.get()) {
    // The chain must end at a concurrent pool; the main queue runs only on its own thread.
    bool serialLink = q->kind_ == Kind::Serial && !q->executor_ && q->target_;
    bool idle = false;
    if (serialLink) {
      std::lock_guard lock(q->mutex_);
      if (!q->drainScheduled_ && q->suspendCount_ == 0 && q->items_.empty()) {
        q->drainScheduled_ = true;  // keeps every other block out, as a running drain would
        idle = true;
      }
    }
    if (!idle) {
      releaseClaimed(claimed);
      claimed.clear();
      return false;
    }
    claimed.push_back(q);
    VSAWorkQueue* next = q->target_.get();
    if (next->executor_ && next->kind_ == Kind::Concurrent) return true;
  }
}

bool VSAWorkQueue::runIfIdle(const Block& block) {
  std::vector<VSAWorkQueue*> claimed;
  if (!claimIdleChain(claimed)) return false;
  {
    // The targets are current too, as the drains they would run it in make them.
    CurrentQueueChainScope targets({claimed.begin() + 1, claimed.end()});
    runItem(block);
  }
  releaseClaimed(claimed);
  return true;
}

// Released innermost first: work that arrived on an inner queue meanwhile is
// handed to its target before the target itself is released.
void VSAWorkQueue::releaseClaimed(const std::vector<VSAWorkQueue*>& claimed) {
  for (VSAWorkQueue* q : claimed) {
    {
      std::lock_guard lock(q->mutex_);
      q->drainScheduled_ = false;
    }
    q->submitDrain();
  }
}

void VSAWorkQueue::barrierSync(Block block) {
  runAndWait([this](Block b) { barrierAsync(std::move(b)); }, std::move(block));
}

void VSAWorkQueue::suspend() {
  std::lock_guard lock(mutex_);
  ++suspendCount_;
}

void VSAWorkQueue::resume() {
  {
    std::lock_guard lock(mutex_);
    if (suspendCount_ == 0) {
      std::fprintf(stderr, "VSAWorkQueue %s: over-resume\n", label_.c_str());
      std::abort();
    }
    if (--suspendCount_ > 0) return;
  }
  if (kind_ == Kind::Serial) {
    submitDrain();
  } else {
    pumpConcurrent();
  }
}

int VSAWorkQueue::suspendCount() const {
  std::lock_guard lock(mutex_);
  return suspendCount_;
}

size_t VSAWorkQueue::depth() const {
  std::lock_guard lock(mutex_);
  return items_.size();
}

void VSAWorkQueue::enqueue(Item item) {
  {
    std::lock_guard lock(mutex_);
    items_.push_back(std::move(item));
  }
  if (kind_ == Kind::Serial) {
    submitDrain();
  } else {
    pumpConcurrent();
  }
}

void VSAWorkQueue::submitToTarget(Block job) {
  if (executor_) {
    executor_->submit(std::move(job));
  } else {
    target_->async(std::move(job));
  }
}

void VSAWorkQueue::runItem(const Block& block) {
  CurrentQueueScope scope(this);
  try {
    block();
  } catch (...) {
    // An exception may not leave a block: end the process here, while the
    // queue is still current, so the crash text names it.
    std::terminate();
  }
}

// Schedules one drain of a serial queue unless one is pending or running.
void VSAWorkQueue::submitDrain() {
  {
    std::lock_guard lock(mutex_);
    if (drainScheduled_ || suspendCount_ > 0 || items_.empty()) return;
    drainScheduled_ = true;
  }
  auto self = shared_from_this();
  submitToTarget([self] { self->drainSerial(); });
}

void VSAWorkQueue::drainSerial() {
  for (int n = 0; n < kSerialBatch; ++n) {
    Item item;
    {
      std::lock_guard lock(mutex_);
      if (suspendCount_ > 0 || items_.empty()) {
        drainScheduled_ = false;
        return;
      }
      item = std::move(items_.front());
      items_.pop_front();
    }
    runItem(item.block);
  }
  {
    std::lock_guard lock(mutex_);
    drainScheduled_ = false;
  }
  submitDrain();
}

void VSAWorkQueue::pumpConcurrent() {
  std::vector<Item> start;
  {
    std::lock_guard lock(mutex_);
    while (suspendCount_ == 0 && !items_.empty() && !barrierRunning_) {
      if (items_.front().barrier) {
        if (running_ == 0) {
          barrierRunning_ = true;
          ++running_;
          start.push_back(std::move(items_.front()));
          items_.pop_front();
        }
        break;
      }
      ++running_;
      start.push_back(std::move(items_.front()));
      items_.pop_front();
    }
  }
  auto self = shared_from_this();
  for (Item& item : start) {
    submitToTarget([self, item = std::move(item)] {
      self->runItem(item.block);
      {
        std::lock_guard lock(self->mutex_);
        --self->running_;
        if (item.barrier) self->barrierRunning_ = false;
      }
      self->pumpConcurrent();
    });
  }
}

bool VSACheckOnQueue(const VSAWorkQueue& queue, const char* function) {
  if (queue.isCurrent()) return true;
  VSALog(kVSALogFault, function, "Called off its queue %s", queue.label());
  return false;
}
