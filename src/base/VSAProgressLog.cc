#include "base/VSAProgressLog.h"

#include <algorithm>
#include <mutex>

namespace {
std::mutex gActiveMutex;
std::vector<const VSAProgressLog*>& activeList() {
  static auto* list = new std::vector<const VSAProgressLog*>;
  return *list;
}
std::atomic<int64_t> gIntervalMs{2000};
}  // namespace

VSAProgressLog::VSAProgressLog(VSALogCategory category, const char* origin, std::string task,
                               uint64_t total, std::string unit)
    : category_(category),
      origin_(origin),
      task_(std::move(task)),
      unit_(std::move(unit)),
      total_(total),
      start_(Clock::now()),
      lastLine_(start_) {
  std::lock_guard lock(gActiveMutex);
  activeList().push_back(this);
}

VSAProgressLog::~VSAProgressLog() {
  {
    std::lock_guard lock(gActiveMutex);
    auto& list = activeList();
    list.erase(std::remove(list.begin(), list.end(), this), list.end());
  }
  if (!shown_) return;
  Snapshot s = snapshot();
  VSALogIn(category_, kVSALogNotice, origin_, "%@: finished, %@ in %.1f s", task_, line(s),
           s.seconds);
}

void VSAProgressLog::advance(uint64_t items, uint64_t bytes) {
  done_.fetch_add(items, std::memory_order_relaxed);
  bytes_.fetch_add(bytes, std::memory_order_relaxed);
  auto now = Clock::now();
  if (now - lastLine_ < std::chrono::milliseconds(gIntervalMs.load(std::memory_order_relaxed)))
    return;
  lastLine_ = now;
  shown_ = true;
  VSALogIn(category_, kVSALogNotice, origin_, "%@: %@", task_, line(snapshot()));
}

VSAProgressLog::Snapshot VSAProgressLog::snapshot() const {
  return {task_,
          unit_,
          done_.load(std::memory_order_relaxed),
          total_.load(std::memory_order_relaxed),
          bytes_.load(std::memory_order_relaxed),
          std::chrono::duration<double>(Clock::now() - start_).count()};
}

std::string VSAProgressLog::line(const Snapshot& s) const {
  std::string text = VSAFormat("%llu/%llu %@", static_cast<unsigned long long>(s.done),
                               static_cast<unsigned long long>(s.total), s.unit);
  if (s.bytes) text += ", " + byteCount(s.bytes);
  return text;
}

std::vector<VSAProgressLog::Snapshot> VSAProgressLog::active() {
  std::lock_guard lock(gActiveMutex);
  std::vector<Snapshot> all;
  for (const VSAProgressLog* p : activeList()) all.push_back(p->snapshot());
  return all;
}

void VSAProgressLog::setInterval(std::chrono::milliseconds interval) {
  gIntervalMs.store(interval.count(), std::memory_order_relaxed);
}

std::string VSAProgressLog::byteCount(uint64_t bytes) {
  static const char* const kUnits[] = {"KB", "MB", "GB", "TB", "PB"};
  if (bytes < 1024) return VSAFormat("%llu bytes", static_cast<unsigned long long>(bytes));
  double value = static_cast<double>(bytes) / 1024;
  size_t unit = 0;
  while (value >= 1024 && unit + 1 < std::size(kUnits)) value /= 1024, ++unit;
  return VSAFormat(value < 10 ? "%.1f %s" : "%.0f %s", value, kUnits[unit]);
}
