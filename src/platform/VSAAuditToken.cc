#include "platform/VSAAuditToken.h"

#include <sys/socket.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <sstream>

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
  std::ifstream in(path);
  std::string line;
  if (!std::getline(in, line)) return 0;
  // The command name may hold spaces and parentheses: fields start after the last ')'.
  size_t close = line.rfind(')');
  if (close == std::string::npos) return 0;
  std::istringstream rest(line.substr(close + 1));
  std::string field;
  // Field 3 (state) is the first after ')'; start time is field 22.
  for (int i = 3; i <= 22 && (rest >> field); ++i) {
    if (i == 22) return std::strtoull(field.c_str(), nullptr, 10);
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
