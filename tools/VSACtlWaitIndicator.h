// A bar on the terminal while vessactl waits on a reply that can take long
// (emptying death row, changing a container's protection class): after half
// a second without a reply it draws a moving bar with the time waited on
// stderr, and clears it when the reply comes. The daemon does not say how
// far the work is, so the bar shows activity, not a fraction. Does nothing
// when stderr is not a terminal.
#pragma once

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>

class VSACtlWaitIndicator {
 public:
  explicit VSACtlWaitIndicator(std::string what);
  ~VSACtlWaitIndicator();
  VSACtlWaitIndicator(const VSACtlWaitIndicator&) = delete;
  VSACtlWaitIndicator& operator=(const VSACtlWaitIndicator&) = delete;

  // The bar's text after `tenths` tenths of a second (a test reads it).
  static std::string frame(const std::string& what, unsigned tenths);

 private:
  void draw();

  std::string what_;
  std::mutex mutex_;
  std::condition_variable done_;
  bool finished_ = false;
  bool drawn_ = false;
  std::thread thread_;
};
