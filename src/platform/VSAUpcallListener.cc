#include "platform/VSAUpcallListener.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <deque>

#include "base/VSALog.h"
#include "platform/VSADescriptorPassing.h"
#include "platform/VSAListeningSocket.h"

namespace {
const char* const kOrigin = "VSAUpcallListener";
// Requests are 56 bytes; a few more are read so that a longer packet is seen as such.
constexpr size_t kReceiveSize = 256;
constexpr int kMaxDescriptors = 4;

bool readAll(int fd, std::vector<uint8_t>* out, uint64_t size) {
  out->resize(size);
  size_t done = 0;
  while (done < size) {
    ssize_t n = ::pread(fd, out->data() + done, size - done, static_cast<off_t>(done));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

// Wakes the I/O thread; shared with the peers, whose replies may come after
// the listener has stopped.
struct VSAUpcallListener::Waker {
  int fd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  ~Waker() {
    if (fd >= 0) ::close(fd);
  }
  void wake() const {
    uint64_t one = 1;
    [[maybe_unused]] ssize_t n = ::write(fd, &one, sizeof one);
  }
};

struct VSAUpcallListener::Peer {
  int fd = -1;
  std::array<uint8_t, 32> token{};
  bool kernel = false;
  std::atomic<int> inFlight{0};
  std::shared_ptr<Waker> waker;
  // Replies the socket did not take yet, in order; at most kMaxInFlight,
  // since a peer is not read while that many are unanswered.
  std::mutex outMutex;
  std::deque<std::pair<std::vector<uint8_t>, int>> out;

  ~Peer() {
    for (auto& [message, memfd] : out)
      if (memfd >= 0) ::close(memfd);
    if (fd >= 0) ::close(fd);
  }
  void send(const std::vector<uint8_t>& message, VSAUniqueFd memory) {
    std::lock_guard lock(outMutex);
    out.emplace_back(message, memory.release());
    // Behind replies already waiting, it waits too; the I/O thread writes
    // them out once the socket has room, so the kernel gets every answer.
    if (!_lock_flush()) waker->wake();
  }
  bool hasPendingReplies() {
    std::lock_guard lock(outMutex);
    return !out.empty();
  }
  // Writes what the socket takes now; false while replies still wait.
  bool flush() {
    std::lock_guard lock(outMutex);
    return _lock_flush();
  }
  bool _lock_flush() {
    while (!out.empty()) {
      auto& [message, memfd] = out.front();
      if (VSASendWithDescriptor(fd, message, memfd, MSG_DONTWAIT) < 0) {
        if (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR) return false;
        VSALogIn(VSALogCategory::Upcall, kVSALogError, kOrigin,
                 "Could not send an upcall reply: %s", std::strerror(errno));
      }
      if (memfd >= 0) ::close(memfd);
      out.pop_front();
      --inFlight;
    }
    return true;
  }
};

VSAUpcallListener::VSAUpcallListener(std::string socketPath,
                                     std::shared_ptr<VSAClientRegistry> registry,
                                     uint64_t maxMemorySize)
    : path_(std::move(socketPath)), registry_(std::move(registry)), maxMemorySize_(maxMemorySize) {}

VSAUpcallListener::~VSAUpcallListener() { stop(); }

bool VSAUpcallListener::bind(VSAErrorRef* error) {
  if (listenFd_ >= 0) return true;
  if (int activated = VSAActivatedListeningSocket(SOCK_SEQPACKET, path_); activated >= 0) {
    listenFd_ = activated;
    ::fcntl(listenFd_, F_SETFL, ::fcntl(listenFd_, F_GETFL) | O_NONBLOCK);
    // The unit gives all its sockets one mode: only root talks to this one.
    ::chmod(path_.c_str(), 0600);
    return true;
  }
  listenFd_ = ::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  int rc = listenFd_ < 0 ? errno : VSABindListeningSocket(listenFd_, path_, 0600, 16);
  if (rc != 0) {
    VSASetError(error, VSA_POSIX_ERROR(rc, VSAFormat("binding %@", path_)));
    if (listenFd_ >= 0) ::close(listenFd_);  // the file at the path is not this one's to remove
    listenFd_ = -1;
    return false;
  }
  ownsSocketFile_ = true;
  return true;
}

bool VSAUpcallListener::start(Handler handler, VSAErrorRef* error) {
  handler_ = std::move(handler);
  waker_ = std::make_shared<Waker>();
  if (waker_->fd < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    stop();
    return false;
  }
  if (!bind(error)) {
    stop();
    return false;
  }
  thread_ = std::thread([this] { run(); });
  return true;
}

void VSAUpcallListener::holdAccepting(bool hold) {
  if (!thread_.joinable()) return;
  {
    std::lock_guard lock(holdMutex_);
    holdRequested_ = hold;
  }
  if (waker_) waker_->wake();
  std::unique_lock lock(holdMutex_);
  while (held_ != hold && !stopping_) holdChanged_.wait_for(lock, std::chrono::milliseconds(100));
}

void VSAUpcallListener::stop() {
  stopping_ = true;
  if (waker_) waker_->wake();
  if (thread_.joinable()) thread_.join();
  peers_.clear();
  peerCount_ = 0;
  if (listenFd_ >= 0) {
    // No stale socket for the next start's waiters; one systemd holds stays.
    if (ownsSocketFile_) ::unlink(path_.c_str());
    ::close(listenFd_);
  }
  waker_.reset();
  listenFd_ = -1;
}

void VSAUpcallListener::run() {
  while (!stopping_) {
    bool hold;
    {
      std::lock_guard lock(holdMutex_);
      hold = holdRequested_;
      if (held_ != hold) {
        held_ = hold;
        holdChanged_.notify_all();
      }
    }
    // A held socket is left out of the poll (a negative descriptor is ignored).
    std::vector<struct pollfd> fds = {{waker_->fd, POLLIN, 0}, {hold ? -1 : listenFd_, POLLIN, 0}};
    std::vector<std::shared_ptr<Peer>> polled;
    for (const auto& p : peers_) {
      short events = p->hasPendingReplies() ? POLLOUT : 0;
      if (p->inFlight < kMaxInFlight) events |= POLLIN;
      if (!events) continue;  // answers still being worked out
      fds.push_back({p->fd, events, 0});
      polled.push_back(p);
    }
    // A full peer is looked at again soon, when its replies have gone out.
    int n = ::poll(fds.data(), fds.size(), polled.size() < peers_.size() ? 10 : -1);
    if (n < 0 && errno != EINTR) break;
    if (stopping_) break;
    if (fds[0].revents & POLLIN) {
      uint64_t count;
      [[maybe_unused]] ssize_t r = ::read(waker_->fd, &count, sizeof count);
    }
    if (fds[1].revents & POLLIN) acceptPeer();
    for (size_t i = 0; i < polled.size(); ++i) {
      short revents = fds[i + 2].revents;
      if (!revents) continue;
      if (revents & POLLOUT) polled[i]->flush();
      if (!(revents & (POLLIN | POLLHUP | POLLERR))) continue;
      // Replies still queued keep a dropped peer alive until they are sent.
      if (!receive(polled[i])) std::erase(peers_, polled[i]);
    }
    peerCount_ = peers_.size();
  }
}

void VSAUpcallListener::acceptPeer() {
  int fd = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
  if (fd < 0) return;
  auto peer = std::make_shared<Peer>();
  peer->fd = fd;
  peer->waker = waker_;
  auto token = VSAAuditToken::fromSocket(fd);
  // A peer outside the daemon's pid namespace is reported with pid 0, the
  // kernel's own: it could never be told apart, so it is not served at all.
  if (!token || token->pid <= 0 || peers_.size() >= kMaxPeers) {
    VSALogIn(VSALogCategory::Upcall, kVSALogError, kOrigin,
             "Refusing an upcall peer (pid %d, %zu open)", token ? token->pid : -1, peers_.size());
    return;  // the peer's destructor closes it
  }
  auto entry = registry_ ? registry_->entryForAuditToken(*token) : std::nullopt;
  peer->kernel = entry && entry->kernelBridge;
  VSAAuditToken sender = *token;
  if (peer->kernel) sender.pid = 0;  // the kernel's messages carry pid 0, and only its
  peer->token = sender.bytes();
  VSALogIn(VSALogCategory::Upcall, kVSALogDebug, kOrigin, "Upcall peer %@ (kernel: %d)",
           token->description(), peer->kernel);
  peers_.push_back(std::move(peer));
  peerCount_ = peers_.size();
  ++accepted_;
}

bool VSAUpcallListener::receive(const std::shared_ptr<Peer>& peer) {
  VSAUpcallPacket packet;
  packet.message.resize(kReceiveSize);
  struct iovec iov = {packet.message.data(), packet.message.size()};
  alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * kMaxDescriptors)] = {};
  struct msghdr msg = {};
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  msg.msg_control = control;
  msg.msg_controllen = sizeof control;
  ssize_t n = ::recvmsg(peer->fd, &msg, MSG_CMSG_CLOEXEC | MSG_DONTWAIT);
  if (n < 0 && (errno == EAGAIN || errno == EINTR)) return true;
  std::vector<int> received = VSAReceivedDescriptors(msg);
  if (n <= 0) {
    for (int fd : received) ::close(fd);
    return false;
  }
  packet.message.resize(static_cast<size_t>(n) + ((msg.msg_flags & MSG_TRUNC) ? 1 : 0));
  packet.malformedDescriptors = received.size() > 1 || (msg.msg_flags & MSG_CTRUNC);
  if (received.size() == 1) {
    struct stat st;
    if (::fstat(received[0], &st) != 0 || !S_ISREG(st.st_mode)) {
      packet.malformedDescriptors = true;
    } else {
      packet.memorySize = static_cast<uint64_t>(st.st_size);
      if (*packet.memorySize <= maxMemorySize_ &&
          !readAll(received[0], &packet.memory, *packet.memorySize))
        packet.malformedDescriptors = true;
    }
  }
  for (int fd : received) ::close(fd);
  packet.auditToken = peer->token;
  packet.fromKernel = peer->kernel;
  ++peer->inFlight;
  handler_(std::move(packet), [peer](const std::vector<uint8_t>& message, VSAUniqueFd memory) {
    peer->send(message, std::move(memory));
  });
  // Anyone but the kernel is answered once (with its refusal) and let go. A
  // listener without a registry (a bare transport, as a benchmark's echo
  // uses) tells no peers apart and keeps them all.
  return peer->kernel || !registry_;
}
