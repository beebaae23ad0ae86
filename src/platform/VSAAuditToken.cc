#include "platform/VSAAuditToken.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "base/VSAFormat.h"

std::optional<VSAAuditToken> VSAAuditToken::fromSocket(int fd) {
  struct ucred cred;
  socklen_t len = sizeof cred;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) return std::nullopt;
  VSAAuditToken t;
  t.pid = cred.pid;
  t.uid = cred.uid;
  t.gid = cred.gid;
  t.startTime = processStartTime(cred.pid);
  return t;
}

namespace {
// Reads /proc/<pid>/<name> into `buf`; its length, or -1.
ssize_t readProcFile(pid_t pid, const char* name, char* buf, size_t size) {
  char path[64];
  std::snprintf(path, sizeof path, "/proc/%d/%s", pid, name);
  int fd = ::open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return -1;
  ssize_t n = ::read(fd, buf, size - 1);
  ::close(fd);
  if (n >= 0) buf[n] = '\0';
  return n;
}

// The effective uid of the "Uid:" line of /proc/<pid>/status (the files'
// owner is root for a process that changed its credentials).
std::optional<uid_t> effectiveUID(pid_t pid) {
  char buf[2048];
  if (readProcFile(pid, "status", buf, sizeof buf) <= 0) return std::nullopt;
  const char* line = std::strstr(buf, "\nUid:");
  unsigned long real = 0, effective = 0;
  if (!line || std::sscanf(line + 5, "%lu %lu", &real, &effective) != 2) return std::nullopt;
  return static_cast<uid_t>(effective);
}
}  // namespace

std::optional<VSAProcessStat> VSAAuditToken::processStat(pid_t pid, bool withUID) {
  if (pid <= 0) return std::nullopt;
  char buf[1024];
  if (readProcFile(pid, "stat", buf, sizeof buf) <= 0) return std::nullopt;
  // The command name may hold spaces and parentheses: fields start after the last ')'.
  const char* p = std::strrchr(buf, ')');
  if (!p) return std::nullopt;
  ++p;
  VSAProcessStat out;
  // Field 3 (state) is the first after ')'; the parent is field 4, the start time 22.
  for (int field = 3; field <= 22; ++field) {
    while (*p == ' ') ++p;
    if (!*p) return std::nullopt;
    if (field == 4) out.parent = static_cast<pid_t>(std::strtol(p, nullptr, 10));
    if (field == 22) out.startTime = std::strtoull(p, nullptr, 10);
    while (*p && *p != ' ') ++p;
  }
  if (withUID) {
    auto uid = effectiveUID(pid);
    if (!uid) return std::nullopt;
    out.uid = *uid;
  }
  return out;
}

uint64_t VSAAuditToken::processStartTime(pid_t pid) {
  auto s = processStat(pid, false);
  return s ? s->startTime : 0;
}

bool VSAAuditToken::isCurrent() const {
  return pid > 0 && startTime != 0 && processStartTime(pid) == startTime;
}

std::array<uint8_t, 32> VSAAuditToken::bytes() const {
  std::array<uint8_t, 32> out{};
  uint32_t words[8] = {static_cast<uint32_t>(uid),
                       static_cast<uint32_t>(uid),
                       static_cast<uint32_t>(gid),
                       static_cast<uint32_t>(uid),
                       static_cast<uint32_t>(gid),
                       static_cast<uint32_t>(pid),
                       static_cast<uint32_t>(startTime >> 32),
                       static_cast<uint32_t>(startTime)};
  std::memcpy(out.data(), words, sizeof words);
  return out;
}

std::string VSAAuditToken::description() const {
  return VSAFormat("<pid %d uid %u gid %u start %llu>", pid, uid, gid, startTime);
}
