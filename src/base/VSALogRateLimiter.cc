#include "base/VSALogRateLimiter.h"

VSALogRateLimiter::VSALogRateLimiter(uint32_t burst, std::chrono::seconds window, size_t maxKeys)
    : burst_(burst), window_(window), maxKeys_(maxKeys < 2 ? 2 : maxKeys) {}

bool VSALogRateLimiter::admit(uint64_t key, uint64_t* suppressed, Clock::time_point now) {
  std::lock_guard lock(mutex_);
  auto it = slots_.find(key);
  if (it == slots_.end()) {
    if (slots_.size() >= maxKeys_) {
      std::erase_if(slots_, [&](const auto& kv) {
        return kv.first != kOverflowKey && now - kv.second.windowStart >= window_ &&
               kv.second.dropped == 0;
      });
    }
    if (slots_.size() >= maxKeys_) key = kOverflowKey;
    it = slots_.try_emplace(key, Slot{now}).first;
  }
  Slot& slot = it->second;
  if (now - slot.windowStart >= window_) {
    slot.windowStart = now;
    slot.written = 0;
  }
  if (slot.written >= burst_) {
    ++slot.dropped;
    return false;
  }
  ++slot.written;
  if (suppressed) *suppressed = slot.dropped;
  slot.dropped = 0;
  return true;
}

VSALogRateLimiter& VSALogRateLimiter::refusals() {
  static VSALogRateLimiter limiter;
  return limiter;
}
