#include "platform/VSAIPCConnection.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/VSALog.h"
#include "platform/VSAFrameCodec.h"

VSAIPCConnection::VSAIPCConnection(int fd, uint64_t identifier, VSAAuditToken auditToken,
                                   VSAClientRegistry* registry, size_t maxPendingOutput)
    : fd_(fd),
      identifier_(identifier),
      auditToken_(auditToken),
      executable_(VSAPeerExecutable::ofProcess(auditToken)),
      processDirectory_(VSAPeerExecutable::openProcessDirectory(auditToken)),
      maxPendingOutput_(maxPendingOutput) {
  // The entry is looked up once, for the file the peer ran when it connected.
  if (registry && executable_ && !executable_->path.empty())
    registryEntry_ = registry->entryForPeer(auditToken_, executable_->path);
}

VSAIPCConnection::~VSAIPCConnection() { ::close(fd_); }

bool VSAIPCConnection::peerIsUnchanged() const {
  if (!executable_) return false;
  return processDirectory_.get() >= 0 ? executable_->isRunByProcessAt(processDirectory_.get())
                                      : executable_->isRunBy(auditToken_);
}

bool VSAIPCConnection::send(const VSAValue& message, VSAErrorRef* error) {
  auto frame = VSAFrameCodec::encode(message, error);
  if (!frame) return false;
  int err = 0;
  size_t pending = 0;
  {
    std::lock_guard lock(outMutex_);
    if (cancelled_.load()) {
      VSASetError(error, VSA_POSIX_ERROR(EPIPE));
      return false;
    }
    pending = out_.size() - outSent_;
    if (pending + frame->size() <= maxPendingOutput_) {
      if (outSent_ > 0 && outSent_ == out_.size()) {
        out_.clear();
        outSent_ = 0;
      }
      out_.insert(out_.end(), frame->begin(), frame->end());
      // Written at once when nothing is waiting ahead of it; never waits for the peer.
      if (pending == 0 && !_lock_writePending(&err)) {
        VSASetError(error, VSA_POSIX_ERROR(err));
        return false;
      }
      _lock_updateInterest();
      return true;
    }
  }
  VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAIPCConnection",
           "Dropping %@: %zu bytes of replies wait for the peer to read them (limit %zu)",
           description(), pending + frame->size(), maxPendingOutput_);
  cancel();
  VSASetError(error, VSA_POSIX_ERROR(ENOBUFS, "the peer does not read its replies"));
  return false;
}

bool VSAIPCConnection::_lock_writePending(int* err) {
  while (outSent_ < out_.size()) {
    ssize_t n =
        ::send(fd_, out_.data() + outSent_, out_.size() - outSent_, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
    if (n <= 0) {
      *err = n < 0 ? errno : EPIPE;
      // The stream is broken mid-frame: nothing more can follow on it.
      out_.clear();
      outSent_ = 0;
      if (!cancelled_.exchange(true)) ::shutdown(fd_, SHUT_RDWR);
      return false;
    }
    outSent_ += static_cast<size_t>(n);
  }
  if (outSent_ == out_.size()) {
    out_.clear();
    outSent_ = 0;
    // A burst of replies should not keep its high-water mark for the connection's life.
    if (out_.capacity() > (1u << 20)) out_.shrink_to_fit();
  }
  return true;
}

void VSAIPCConnection::_lock_updateInterest() {
  if (epollFd_ < 0) return;
  uint32_t want = 0;
  if (reading_ && !throttled_.load()) want |= EPOLLIN | EPOLLRDHUP;
  if (out_.size() > outSent_) want |= EPOLLOUT;
  if (want == interest_) return;
  epoll_event ev{};
  ev.events = want;
  ev.data.fd = fd_;
  if (epoll_ctl(epollFd_, EPOLL_CTL_MOD, fd_, &ev) == 0) interest_ = want;
}

void VSAIPCConnection::attachToPoller(int epollFd) {
  std::lock_guard lock(outMutex_);
  epollFd_ = epollFd;
  interest_ = epollFd >= 0 ? EPOLLIN | EPOLLRDHUP : 0;
  _lock_updateInterest();
}

void VSAIPCConnection::setReading(bool reading) {
  std::lock_guard lock(outMutex_);
  reading_ = reading;
  _lock_updateInterest();
}

bool VSAIPCConnection::flushPendingOutput() {
  std::lock_guard lock(outMutex_);
  int err = 0;
  bool ok = _lock_writePending(&err);
  _lock_updateInterest();
  return ok;
}

size_t VSAIPCConnection::pendingOutput() const {
  std::lock_guard lock(outMutex_);
  return out_.size() - outSent_;
}

void VSAIPCConnection::requestBegan() { ++inFlight_; }

size_t VSAIPCConnection::requestEnded() {
  lastRequestEnded_.store(std::chrono::steady_clock::now().time_since_epoch().count());
  return --inFlight_;
}

void VSAIPCConnection::setThrottled(bool throttled) {
  std::lock_guard lock(outMutex_);
  throttled_.store(throttled);
  _lock_updateInterest();
}

std::chrono::steady_clock::time_point VSAIPCConnection::lastRequestEnded() const {
  return std::chrono::steady_clock::time_point(
      std::chrono::steady_clock::duration(lastRequestEnded_.load()));
}

void VSAIPCConnection::cancel() {
  if (!cancelled_.exchange(true)) ::shutdown(fd_, SHUT_RDWR);
}

std::string VSAIPCConnection::description() const {
  return VSAFormat("<connection %llu %@>", identifier_, auditToken_);
}
