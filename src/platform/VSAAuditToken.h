// The identity of a peer process as the kernel reports it.
//
// pid, effective uid and gid come from SO_PEERCRED; the process start time
// (from /proc/<pid>/stat) makes the token unique even when a pid is reused:
// a token whose start time no longer matches names a process that is gone.
// The 32-byte form is what replies and logs compare byte for byte; the
// all-zero token stands for the daemon itself. Value type.
#pragma once

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <optional>
#include <string>

// What /proc says of a live process.
struct VSAProcessStat {
  pid_t parent = 0;
  uint64_t startTime = 0;  // clock ticks since boot
  uid_t uid = 0;           // effective user, when asked for
};

struct VSAAuditToken {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  uint64_t startTime = 0;

  static std::optional<VSAAuditToken> fromSocket(int fd);
  // The start time of a live process in clock ticks since boot; 0 if gone.
  static uint64_t processStartTime(pid_t pid);
  // Parent and start time; the effective uid too when asked (one more read).
  static std::optional<VSAProcessStat> processStat(pid_t pid, bool withUID);
  // The token still names the same, living process.
  bool isCurrent() const;
  std::array<uint8_t, 32> bytes() const;
  std::string description() const;

  friend bool operator==(const VSAAuditToken&, const VSAAuditToken&) = default;
};
