#include "platform/VSAPeerExecutable.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdio>

#include "base/VSAFormat.h"

namespace {
std::string exeLink(pid_t pid) {
  char path[64];
  std::snprintf(path, sizeof path, "/proc/%d/exe", pid);
  return path;
}

bool sameFile(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}
}  // namespace

std::optional<VSAPeerExecutable> VSAPeerExecutable::ofProcess(const VSAAuditToken& token) {
  if (token.pid <= 0) return std::nullopt;
  std::string link = exeLink(token.pid);
  // stat() follows the magic link to the file the process executes, even when
  // that file has been renamed or deleted since.
  struct stat before, after;
  if (stat(link.c_str(), &before) != 0) return std::nullopt;
  char buf[PATH_MAX];
  ssize_t n = readlink(link.c_str(), buf, sizeof buf);
  if (stat(link.c_str(), &after) != 0 || !sameFile(before, after)) return std::nullopt;
  // Only now is it certain that what was read belongs to the process the token names.
  if (!token.isCurrent()) return std::nullopt;
  VSAPeerExecutable pinned;
  pinned.device = before.st_dev;
  pinned.inode = before.st_ino;
  if (n > 0 && n < static_cast<ssize_t>(sizeof buf)) {
    std::string path(buf, static_cast<size_t>(n));
    struct stat named;
    // The path is kept only while it still leads to the running file.
    if (stat(path.c_str(), &named) == 0 && sameFile(named, before)) pinned.path = std::move(path);
  }
  return pinned;
}

bool VSAPeerExecutable::isRunBy(const VSAAuditToken& token) const {
  struct stat st;
  if (token.pid <= 0 || stat(exeLink(token.pid).c_str(), &st) != 0) return false;
  if (st.st_dev != device || st.st_ino != inode) return false;
  // Checked after the stat, so the file examined surely belonged to this process.
  return token.isCurrent();
}

int VSAPeerExecutable::openProcessDirectory(const VSAAuditToken& token) {
  if (token.pid <= 0) return -1;
  char path[64];
  std::snprintf(path, sizeof path, "/proc/%d", token.pid);
  int fd = ::open(path, O_PATH | O_DIRECTORY | O_CLOEXEC);
  // Checked after the open: the directory opened is surely the token's process.
  if (fd >= 0 && !token.isCurrent()) {
    ::close(fd);
    return -1;
  }
  return fd;
}

bool VSAPeerExecutable::isRunByProcessAt(int processDirectory) const {
  struct stat st;
  return processDirectory >= 0 && ::fstatat(processDirectory, "exe", &st, 0) == 0 &&
         st.st_dev == device && st.st_ino == inode;
}

std::string VSAPeerExecutable::description() const {
  return VSAFormat("<executable %s dev %llu ino %llu>", path.empty() ? "?" : path.c_str(),
                   static_cast<unsigned long long>(device), static_cast<unsigned long long>(inode));
}
