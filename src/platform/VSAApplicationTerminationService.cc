#include "platform/VSAApplicationTerminationService.h"

#include <dirent.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>

#include "base/VSALog.h"
#include "base/VSAPlist.h"
#include "base/VSAWorkQueue.h"

VSAApplicationTerminationService::VSAApplicationTerminationService(
    VSASystemRoot root, std::shared_ptr<VSAClientRegistry> registry)
    : root_(std::move(root)), registry_(std::move(registry)) {}

std::string VSAApplicationTerminationService::recordPath(
    const std::string& bundleIdentifier) const {
  return root_.resolve("/run/vessad/termination-assertions/" + bundleIdentifier);
}

int VSAApplicationTerminationService::terminateProcessesOf(const std::string& bundleIdentifier) {
  DIR* proc = opendir("/proc");
  if (!proc) return errno;
  int failures = 0;
  while (struct dirent* e = readdir(proc)) {
    char* end = nullptr;
    long pid = std::strtol(e->d_name, &end, 10);
    if (*end || pid <= 1 || pid == getpid()) continue;
    char buf[PATH_MAX];
    std::string link = std::string("/proc/") + e->d_name + "/exe";
    if (!realpath(link.c_str(), buf)) continue;
    auto entry = registry_->entryForExecutable(buf);
    if (!entry || entry->signingIdentifier != bundleIdentifier) continue;
    if (kill(static_cast<pid_t>(pid), SIGKILL) != 0 && errno != ESRCH)
      ++failures;
    else
      VSALog(kVSALogNotice, "VSAApplicationTerminationService", "Terminated %s (pid %ld)",
             bundleIdentifier, pid);
  }
  closedir(proc);
  return failures ? EPERM : 0;
}

std::optional<VSAApplicationTerminationService::Handle>
VSAApplicationTerminationService::createAssertion(const std::string& bundleIdentifier,
                                                  Reason reason,
                                                  std::function<void(VSAErrorRef)> acquired) {
  if (bundleIdentifier.empty() || bundleIdentifier.find('/') != std::string::npos ||
      bundleIdentifier[0] == '.')
    return std::nullopt;
  Handle handle;
  {
    std::lock_guard lock(mutex_);
    handle = next_++;
    handles_[handle] = bundleIdentifier;
    ++holds_[bundleIdentifier];
    std::string dir = root_.resolve("/run/vessad/termination-assertions");
    VSAMakeDirectories(dir);
    std::string text = std::to_string(static_cast<int>(reason)) + "\n";
    VSAWriteFileAtomically(recordPath(bundleIdentifier),
                           std::vector<uint8_t>(text.begin(), text.end()), 0644, nullptr);
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
