// Progress of long work: death-row emptying, migrations, boot cleanup.
//
// While the work runs it writes "<task>: <done>/<total> <unit>" (with the
// bytes when it counts them) to the log, at most once per interval (2 s by
// default); work that ends before its first line logs nothing more, and
// work that showed progress logs a closing line with its duration. Every
// object is listed while it lives, so the state dump can say what is under
// way. advance() is for the one thread doing the work; snapshots may be
// taken from any thread.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include "base/VSALog.h"

class VSAProgressLog {
 public:
  using Clock = std::chrono::steady_clock;
  struct Snapshot {
    std::string task, unit;
    uint64_t done, total, bytes;
    double seconds;  // since the work began
  };

  VSAProgressLog(VSALogCategory category, const char* origin, std::string task, uint64_t total,
                 std::string unit = "items");
  ~VSAProgressLog();
  VSAProgressLog(const VSAProgressLog&) = delete;
  VSAProgressLog& operator=(const VSAProgressLog&) = delete;

  void setTotal(uint64_t total) { total_.store(total, std::memory_order_relaxed); }
  void advance(uint64_t items = 1, uint64_t bytes = 0);
  void addBytes(uint64_t bytes) { advance(0, bytes); }
  Snapshot snapshot() const;
  // Whether a progress line has been written (the closing line follows then).
  bool shown() const { return shown_; }

  // The work under way in this process, oldest first.
  static std::vector<Snapshot> active();
  // The shortest time between two lines of one task; tests shorten it.
  static void setInterval(std::chrono::milliseconds interval);
  // "1.5 MB", "312 bytes": sizes for people (powers of 1024).
  static std::string byteCount(uint64_t bytes);

 private:
  std::string line(const Snapshot& s) const;

  VSALogCategory category_;
  const char* origin_;
  std::string task_, unit_;
  std::atomic<uint64_t> done_{0}, total_{0}, bytes_{0};
  Clock::time_point start_, lastLine_;
  bool shown_ = false;
};
