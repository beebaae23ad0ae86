#include "platform/VSAAuditToken.h"

#include <fcntl.h>
#include <sys/socket.h>
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

uint64_t VSAAuditToken::processStartTime(pid_t pid) {
  if (pid <= 0) return 0;
  char path[64];
  std::snprintf(path, sizeof path, "/proc/%d/stat", pid);
  int fd = ::open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return 0;
  char buf[1024];
  ssize_t n = ::read(fd, buf, sizeof buf - 1);
  ::close(fd);
  if (n <= 0) return 0;
  buf[n] = '\0';
  // The command name may hold spaces and parentheses: fields start after the last ')'.
  const char* p = std::strrchr(buf, ')');
  if (!p) return 0;
  ++p;
  // Field 3 (state) is the first after ')'; start time is field 22.
  for (int field = 3; field <= 22; ++field) {
    while (*p == ' ') ++p;
    if (!*p) return 0;
    if (field == 22) return std::strtoull(p, nullptr, 10);
    while (*p && *p != ' ') ++p;
  }
  return 0;
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
