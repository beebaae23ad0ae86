// Watches one directory with inotify and reports changes of named entries.
//
// A background thread waits on the inotify descriptor; for each change of an
// entry whose name is in the watched set (created, written and closed,
// renamed in, deleted) the handler is called on the given work queue. The
// destructor stops and joins the thread, waits for a handler that is running
// on another thread, and turns away the ones still queued: no handler runs
// after it returns. A handler may destroy its own watcher.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>

#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"

class VSAInotifyWatcher {
 public:
  using Handler = std::function<void(const std::string& name)>;

  VSAInotifyWatcher(std::string directory, std::set<std::string> names, VSAWorkQueue::Ref queue,
                    Handler handler);
  ~VSAInotifyWatcher();
  VSAInotifyWatcher(const VSAInotifyWatcher&) = delete;
  VSAInotifyWatcher& operator=(const VSAInotifyWatcher&) = delete;

  // Starts watching; the directory must exist.
  bool start(VSAErrorRef* error);

 private:
  void run();

  // Shared with the queued calls: closed by the destructor. Recursive, so
  // that a handler can destroy the watcher that called it.
  // `open` is cleared before the mutex is taken, so a queued call that wins
  // the mutex from the destructor still sees the gate closed.
  struct Gate {
    std::recursive_mutex mutex;
    std::atomic<bool> open{true};
  };

  std::shared_ptr<Gate> gate_ = std::make_shared<Gate>();
  std::string directory_;
  std::set<std::string> names_;
  VSAWorkQueue::Ref queue_;
  Handler handler_;
  int inotifyFd_ = -1;
  int stopFd_ = -1;
  std::thread thread_;
};
