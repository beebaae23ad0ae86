// Keeps one noisy client from rotating the whole log away: at most `burst`
// lines per key (a client's uid) in each window; lines past that are counted
// and the count is reported with the first line of a later window. The table
// of keys is bounded: when it is full, keys whose window has closed are
// forgotten, and if none has, the new key shares one overflow slot.
// Thread-safe.
#pragma once

#include <chrono>
#include <cstdint>
#include <mutex>
#include <unordered_map>

class VSALogRateLimiter {
 public:
  using Clock = std::chrono::steady_clock;

  explicit VSALogRateLimiter(uint32_t burst = 20,
                             std::chrono::seconds window = std::chrono::seconds(60),
                             size_t maxKeys = 1024);

  // True when a line for `key` may be written at `now`; `suppressed` then
  // receives how many lines of that key were dropped since the last one written.
  bool admit(uint64_t key, uint64_t* suppressed = nullptr, Clock::time_point now = Clock::now());

  // The limiter shared by the request-refusal lines of every client.
  static VSALogRateLimiter& refusals();

 private:
  struct Slot {
    Clock::time_point windowStart;
    uint32_t written = 0;
    uint64_t dropped = 0;
  };
  static constexpr uint64_t kOverflowKey = ~0ull;

  uint32_t burst_;
  Clock::duration window_;
  size_t maxKeys_;
  std::mutex mutex_;
  std::unordered_map<uint64_t, Slot> slots_;
};
