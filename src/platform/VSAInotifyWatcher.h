// Watches one directory with inotify and reports changes of named entries.
//
// A background thread waits on the inotify descriptor; for each change of an
// entry whose name is in the watched set (created, written and closed,
// renamed in, deleted) the handler is called on the given work queue. The
// destructor stops and joins the thread; no handler is submitted after it
// returns.
#pragma once

#include <functional>
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

  std::string directory_;
  std::set<std::string> names_;
  VSAWorkQueue::Ref queue_;
  Handler handler_;
  int inotifyFd_ = -1;
  int stopFd_ = -1;
  std::thread thread_;
};
