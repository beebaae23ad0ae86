#include "platform/VSAApplicationTerminationService.h"

#include <dirent.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <set>
#include <utility>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "base/VSAWorkQueue.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSAUniqueFd.h"

namespace {
const char* const kOrigin = "VSAApplicationTerminationService";

using FileId = std::pair<dev_t, ino_t>;

// Sends SIGKILL to `pid` if it still runs one of `files`. The pid is pinned
// with a pidfd before its executable is examined, so a pid reused in between
// is never signalled on the strength of another process's executable.
// 0 when killed, ESRCH when it is not one of ours (or gone), else an errno.
int killIfRunning(pid_t pid, const std::set<FileId>& files) {
  VSAUniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
  bool pinned = static_cast<bool>(pidfd);
  if (!pinned && errno != ENOSYS) return ESRCH;
  struct stat st;
  std::string exe = "/proc/" + std::to_string(pid) + "/exe";
  if (::stat(exe.c_str(), &st) != 0 || !files.count({st.st_dev, st.st_ino})) return ESRCH;
  int rc =
      pinned ? static_cast<int>(::syscall(SYS_pidfd_send_signal, pidfd.get(), SIGKILL, nullptr, 0))
             : ::kill(pid, SIGKILL);
  return rc == 0 ? 0 : errno;
}
}  // namespace

VSAApplicationTerminationService::VSAApplicationTerminationService(
    VSASystemRoot root, std::shared_ptr<VSAClientRegistry> registry,
    std::shared_ptr<VSAFileSystem> fileSystem)
    : root_(std::move(root)),
      registry_(std::move(registry)),
      fileSystem_(fileSystem ? std::move(fileSystem) : std::make_shared<VSALinuxFileSystem>()) {}

std::string VSAApplicationTerminationService::recordPath(
    const std::string& bundleIdentifier) const {
  return root_.resolve("/run/vessad/termination-assertions/" + bundleIdentifier);
}

int VSAApplicationTerminationService::terminateProcessesOf(const std::string& bundleIdentifier) {
  // The files of this root that run as the application. An entry whose
  // executable is reached through a link names a file that may belong to
  // anyone (another root, the host): it matches nothing.
  std::set<FileId> files;
  for (const auto& entry : registry_->entriesForSigningIdentifier(bundleIdentifier)) {
    struct stat st;
    int rc = fileSystem_->lstat(entry.rootPath, &st);
    if (rc == 0 && S_ISREG(st.st_mode)) {
      files.insert({st.st_dev, st.st_ino});
      continue;
    }
    VSALog(kVSALogError, kOrigin,
           "Not terminating processes of %s that run %s: not a regular file inside the root (%s)",
           bundleIdentifier, entry.rootPath, rc ? std::strerror(rc) : "not a regular file");
  }
  if (files.empty()) return 0;
  DIR* proc = opendir("/proc");
  if (!proc) return errno;
  int failures = 0;
  while (struct dirent* e = readdir(proc)) {
    char* end = nullptr;
    long pid = std::strtol(e->d_name, &end, 10);
    if (*end || pid <= 1 || pid == getpid()) continue;
    int rc = killIfRunning(static_cast<pid_t>(pid), files);
    if (rc == 0)
      VSALog(kVSALogNotice, kOrigin, "Terminated %s (pid %ld)", bundleIdentifier, pid);
    else if (rc != ESRCH)
      ++failures;
  }
  closedir(proc);
  return failures ? EPERM : 0;
}

std::optional<VSAApplicationTerminationService::Handle>
VSAApplicationTerminationService::createAssertion(const std::string& bundleIdentifier,
                                                  Reason reason,
                                                  std::function<void(VSAErrorRef)> acquired) {
  // The identifier names the record file: it must stay one name in its directory.
  if (!VSAIsSafeFileName(bundleIdentifier) || bundleIdentifier[0] == '.') {
    VSALog(kVSALogError, kOrigin, "Refusing a termination assertion for %s: not a valid name",
           VSAClientStringForLog(bundleIdentifier));
    return std::nullopt;
  }
  Handle handle;
  {
    std::lock_guard lock(mutex_);
    std::string dir = root_.resolve("/run/vessad/termination-assertions");
    std::string text = std::to_string(static_cast<int>(reason)) + "\n";
    VSAErrorRef error;
    int dirError = VSAMakeDirectories(dir);
    if (dirError) error = VSA_POSIX_ERROR(dirError);
    // The launcher knows of the hold only through its record: without one
    // the application could start again, so no assertion is given.
    if (dirError ||
        !VSAWriteFileAtomically(recordPath(bundleIdentifier),
                                std::vector<uint8_t>(text.begin(), text.end()), 0644, &error)) {
      VSALog(kVSALogError, kOrigin, "Failed to record termination assertion for %s at %s: %@",
             bundleIdentifier, recordPath(bundleIdentifier), error);
      return std::nullopt;
    }
    handle = next_++;
    handles_[handle] = bundleIdentifier;
    ++holds_[bundleIdentifier];
  }
  // The record is in place first, so nothing relaunches between kill and hold.
  // The global queue may run this after its owner let go of the service.
  VSAWorkQueue::global()->async([self = shared_from_this(), bundleIdentifier,
                                 acquired = std::move(acquired)] {
    int rc = self->terminateProcessesOf(bundleIdentifier);
    acquired(rc ? VSA_POSIX_ERROR(rc, "could not terminate every process of " + bundleIdentifier)
                : nullptr);
  });
  return handle;
}

void VSAApplicationTerminationService::invalidate(Handle handle) {
  std::lock_guard lock(mutex_);
  auto it = handles_.find(handle);
  if (it == handles_.end()) return;
  std::string id = it->second;
  handles_.erase(it);
  if (--holds_[id] == 0) {
    holds_.erase(id);
    unlink(recordPath(id).c_str());
  }
}

bool VSAApplicationTerminationService::isHeld(const std::string& bundleIdentifier) const {
  std::lock_guard lock(mutex_);
  return holds_.count(bundleIdentifier) > 0;
}
