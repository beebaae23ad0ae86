#include "platform/VSAIPCListener.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/VSALog.h"
#include "platform/VSAFrameCodec.h"

struct VSAIPCListener::Peer {
  VSAIPCConnectionRef connection;
  VSAFrameReader reader;
};

VSAIPCListener::VSAIPCListener(std::string socketPath, VSAWorkQueue::Ref queue,
                               std::shared_ptr<VSATransactions> transactions,
                               std::shared_ptr<VSAClientRegistry> registry)
    : socketPath_(std::move(socketPath)),
      queue_(std::move(queue)),
      transactions_(std::move(transactions)),
      registry_(std::move(registry)) {}

VSAIPCListener::~VSAIPCListener() { stop(); }

namespace {
bool fillAddress(const std::string& path, sockaddr_un& addr) {
  std::memset(&addr, 0, sizeof addr);
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof addr.sun_path) return false;
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  return true;
}

// A socket file that still accepts connections belongs to a running daemon.
bool socketIsServed(const sockaddr_un& addr) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  bool served = connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) == 0;
  ::close(fd);
  return served;
}
}  // namespace

bool VSAIPCListener::listen(VSAErrorRef* error) {
  if (sd_listen_fds(0) >= 1 &&
      sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, socketPath_.c_str(), 0) > 0) {
    listenFd_ = SD_LISTEN_FDS_START;  // socket activation: systemd owns the file
  } else {
    sockaddr_un addr;
    if (!fillAddress(socketPath_, addr)) {
      VSASetError(error, VSA_POSIX_ERROR(ENAMETOOLONG));
      return false;
    }
    if (socketIsServed(addr)) {
      VSASetError(error, VSA_POSIX_ERROR(EADDRINUSE, "another daemon serves " + socketPath_));
      return false;
    }
    ::unlink(socketPath_.c_str());
    listenFd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (listenFd_ < 0 || bind(listenFd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
        chmod(socketPath_.c_str(), 0666) != 0 || ::listen(listenFd_, 128) != 0) {
      int err = errno;
      if (listenFd_ >= 0) ::close(listenFd_);
      listenFd_ = -1;
      VSASetError(error, VSA_POSIX_ERROR(err));
      return false;
    }
    ownsSocketFile_ = true;
  }
  fcntl(listenFd_, F_SETFL, fcntl(listenFd_, F_GETFL) | O_NONBLOCK);
  epollFd_ = epoll_create1(EPOLL_CLOEXEC);
  stopFd_ = eventfd(0, EFD_CLOEXEC);
  if (epollFd_ < 0 || stopFd_ < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    return false;
  }
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.fd = listenFd_;
  epoll_ctl(epollFd_, EPOLL_CTL_ADD, listenFd_, &ev);
  ev.data.fd = stopFd_;
  epoll_ctl(epollFd_, EPOLL_CTL_ADD, stopFd_, &ev);
  return true;
}

void VSAIPCListener::setHandler(Handler handler) {
  std::lock_guard lock(handlerMutex_);
  handler_ = std::move(handler);
}

void VSAIPCListener::resume() {
  if (listenFd_ < 0 || thread_.joinable()) return;
  thread_ = std::thread([this] { run(); });
}

void VSAIPCListener::stopAccepting() {
  if (thread_.joinable()) {
    uint64_t one = 1;
    (void)!::write(stopFd_, &one, sizeof one);
    thread_.join();
  }
  if (listenFd_ >= 0) {
    ::close(listenFd_);
    if (ownsSocketFile_) ::unlink(socketPath_.c_str());
  }
  listenFd_ = -1;
}

void VSAIPCListener::stop() {
  stopAccepting();
  {
    std::lock_guard lock(peersMutex_);
    for (auto& [fd, peer] : peers_) peer->connection->cancel();
    peers_.clear();
  }
  if (epollFd_ >= 0) ::close(epollFd_);
  if (stopFd_ >= 0) ::close(stopFd_);
  epollFd_ = stopFd_ = -1;
}

size_t VSAIPCListener::connectionCount() const {
  std::lock_guard lock(peersMutex_);
  return peers_.size();
}

void VSAIPCListener::run() {
  pthread_setname_np(pthread_self(), "vessa-ipc");
  epoll_event events[64];
  for (;;) {
    int n = epoll_wait(epollFd_, events, 64, -1);
    if (n < 0) {
      if (errno == EINTR) continue;
      VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAIPCListener", "epoll_wait failed: %s",
               strerror(errno));
      return;
    }
    for (int i = 0; i < n; ++i) {
      int fd = events[i].data.fd;
      if (fd == stopFd_) return;
      if (fd == listenFd_) {
        acceptPeers();
      } else {
        readPeer(fd);
      }
    }
  }
}

void VSAIPCListener::acceptPeers() {
  for (;;) {
    int fd = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK)
        VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAIPCListener", "accept failed: %s",
                 strerror(errno));
      return;
    }
    auto token = VSAAuditToken::fromSocket(fd);
    if (!token) {
      ::close(fd);
      continue;
    }
    auto peer = std::make_unique<Peer>();
    {
      std::lock_guard lock(peersMutex_);
      // Pins the peer's executable and identity now, before it can exec
      // anything else.
      peer->connection =
          std::make_shared<VSAIPCConnection>(fd, nextIdentifier_++, *token, registry_.get());
      peers_[fd] = std::move(peer);
    }
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLRDHUP;
    ev.data.fd = fd;
    epoll_ctl(epollFd_, EPOLL_CTL_ADD, fd, &ev);
  }
}

void VSAIPCListener::dropPeer(int fd, const char* why) {
  epoll_ctl(epollFd_, EPOLL_CTL_DEL, fd, nullptr);
  std::lock_guard lock(peersMutex_);
  auto it = peers_.find(fd);
  if (it == peers_.end()) return;
  if (why)
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAIPCListener", "Dropping %@: %s",
             it->second->connection->description(), why);
  it->second->connection->cancel();
  peers_.erase(it);
}

void VSAIPCListener::readPeer(int fd) {
  Peer* peer;
  {
    std::lock_guard lock(peersMutex_);
    auto it = peers_.find(fd);
    if (it == peers_.end()) return;
    peer = it->second.get();
  }
  uint8_t buf[65536];
  for (;;) {
    ssize_t n = recv(fd, buf, sizeof buf, MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return;
    if (n <= 0) {
      // A peer that goes away between frames is ordinary; inside a frame it is
      // not.
      dropPeer(fd, n == 0 && peer->reader.pending() > 0 ? "stream ended inside a frame" : nullptr);
      return;
    }
    peer->reader.append(buf, static_cast<size_t>(n));
    std::vector<uint8_t> payload;
    for (;;) {
      auto status = peer->reader.next(payload);
      if (status == VSAFrameReader::Status::NeedMore) break;
      if (status == VSAFrameReader::Status::Oversized) {
        VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAIPCListener",
                 "Frame of %u bytes exceeds the limit of %u bytes", peer->reader.oversizedLength(),
                 VSAFrameCodec::kMaxFrameSize);
        dropPeer(fd, "oversized frame");
        return;
      }
      std::string why;
      auto body = VSAFrameCodec::decodePayload(payload.data(), payload.size(), &why);
      deliver(peer->connection, std::move(body), why);
    }
  }
}

void VSAIPCListener::deliver(const VSAIPCConnectionRef& connection, std::optional<VSAValue> body,
                             std::string problem) {
  auto message = std::make_shared<VSAIPCMessage>(connection, std::move(body), std::move(problem),
                                                 transactions_->open());
  Handler handler;
  {
    std::lock_guard lock(handlerMutex_);
    handler = handler_;
  }
  queue_->async([handler, message] {
    if (handler) handler(message);
  });
}
