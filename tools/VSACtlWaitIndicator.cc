#include "VSACtlWaitIndicator.h"

#include <unistd.h>

#include <chrono>
#include <cstdio>

#include "base/VSAFormat.h"

namespace {
constexpr unsigned kWidth = 24;  // cells of the bar
constexpr unsigned kBlock = 4;   // cells the moving block fills
}  // namespace

VSACtlWaitIndicator::VSACtlWaitIndicator(std::string what) : what_(std::move(what)) {
  if (::isatty(STDERR_FILENO)) thread_ = std::thread([this] { draw(); });
}

VSACtlWaitIndicator::~VSACtlWaitIndicator() {
  if (!thread_.joinable()) return;
  {
    std::lock_guard lock(mutex_);
    finished_ = true;
  }
  done_.notify_all();
  thread_.join();
  if (drawn_) std::fputs("\r\033[K", stderr);  // the reply's lines start on a clean line
}

std::string VSACtlWaitIndicator::frame(const std::string& what, unsigned tenths) {
  // The block goes right, then back, one cell per tenth of a second.
  unsigned span = kWidth - kBlock, step = tenths % (2 * span);
  unsigned at = step < span ? step : 2 * span - step;
  std::string bar(kWidth, ' ');
  bar.replace(at, kBlock, kBlock, '=');
  return VSAFormat("[%@] %u.%u s  %@", bar, tenths / 10, tenths % 10, what);
}

void VSACtlWaitIndicator::draw() {
  std::unique_lock lock(mutex_);
  if (done_.wait_for(lock, std::chrono::milliseconds(500), [this] { return finished_; })) return;
  for (unsigned tenths = 5;; ++tenths) {
    std::fprintf(stderr, "\r%s", frame(what_, tenths).c_str());
    std::fflush(stderr);
    drawn_ = true;
    if (done_.wait_for(lock, std::chrono::milliseconds(100), [this] { return finished_; })) return;
  }
}
