#include "platform/VSAInotifyWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>

VSAInotifyWatcher::VSAInotifyWatcher(std::string directory, std::set<std::string> names,
                                     VSAWorkQueue::Ref queue, Handler handler)
    : directory_(std::move(directory)),
      names_(std::move(names)),
      queue_(std::move(queue)),
      handler_(std::move(handler)) {}

VSAInotifyWatcher::~VSAInotifyWatcher() {
  gate_->open = false;
  if (thread_.joinable()) {
    uint64_t one = 1;
    (void)!::write(stopFd_, &one, sizeof one);
    thread_.join();
  }
  if (inotifyFd_ >= 0) ::close(inotifyFd_);
  if (stopFd_ >= 0) ::close(stopFd_);
  std::lock_guard wait(gate_->mutex);  // a handler running elsewhere finishes first
}

bool VSAInotifyWatcher::start(VSAErrorRef* error) {
  inotifyFd_ = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  stopFd_ = eventfd(0, EFD_CLOEXEC);
  if (inotifyFd_ < 0 || stopFd_ < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    return false;
  }
  uint32_t mask = IN_CLOSE_WRITE | IN_MOVED_TO | IN_CREATE | IN_DELETE | IN_MOVED_FROM;
  if (inotify_add_watch(inotifyFd_, directory_.c_str(), mask) < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    return false;
  }
  // Under the gate: a handler (which may destroy this watcher) runs only
  // after the thread is stored, even when a change arrives at once.
  std::lock_guard lock(gate_->mutex);
  thread_ = std::thread([this] { run(); });
  return true;
}

void VSAInotifyWatcher::run() {
  alignas(struct inotify_event) char buf[8192];
  for (;;) {
    struct pollfd fds[2] = {{inotifyFd_, POLLIN, 0}, {stopFd_, POLLIN, 0}};
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      return;
    }
    if (fds[1].revents) return;
    ssize_t n = ::read(inotifyFd_, buf, sizeof buf);
    if (n <= 0) continue;
    std::set<std::string> changed;
    for (char* p = buf; p < buf + n;) {
      auto* ev = reinterpret_cast<struct inotify_event*>(p);
      if (ev->len > 0 && names_.count(ev->name)) changed.insert(ev->name);
      p += sizeof(struct inotify_event) + ev->len;
    }
    for (const std::string& name : changed) {
      queue_->async([gate = gate_, h = handler_, name] {
        std::lock_guard lock(gate->mutex);
        if (gate->open) h(name);
      });
    }
  }
}
