#include "platform/VSAIPCListener.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "base/VSALog.h"
#include "platform/VSAFrameCodec.h"
#include "platform/VSAListeningSocket.h"

namespace {
constexpr const char* kOrigin = "VSAIPCListener";
// How long accepting pauses when not even the reserve descriptor can be had.
constexpr auto kAcceptPause = std::chrono::milliseconds(100);
constexpr auto kRefusalLogInterval = std::chrono::seconds(1);
}  // namespace

struct VSAIPCListener::Peer {
  VSAIPCConnectionRef connection;
  VSAFrameReader reader;
  std::pair<pid_t, uint64_t> process;
  Clock::time_point lastFrame;     // accept, or the last complete frame
  Clock::time_point frameStarted;  // first byte of the incomplete frame; epoch if none
  size_t countedInput = 0;         // this peer's share of bufferedInput_
};

// Connections whose input may resume, handed from whichever thread finished
// their requests to the I/O thread. Shared with the messages, which can
// outlive the listener: once it stops, `fd` is -1 and posts are ignored.
struct VSAIPCListener::Resumer {
  std::mutex mutex;
  int fd = -1;
  std::vector<std::weak_ptr<VSAIPCConnection>> waiting;

  void post(const VSAIPCConnectionRef& connection) {
    std::lock_guard lock(mutex);
    if (fd < 0) return;
    waiting.push_back(connection);
    uint64_t one = 1;
    (void)!::write(fd, &one, sizeof one);
  }
};

VSAIPCListener::VSAIPCListener(std::string socketPath, VSAWorkQueue::Ref queue,
                               std::shared_ptr<VSATransactions> transactions,
                               std::shared_ptr<VSAClientRegistry> registry,
                               VSAIPCListenerLimits limits)
    : socketPath_(std::move(socketPath)),
      queue_(std::move(queue)),
      transactions_(std::move(transactions)),
      registry_(std::move(registry)),
      limits_(limits),
      resumer_(std::make_shared<Resumer>()) {}

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

int openReserve() { return ::open("/dev/null", O_RDONLY | O_CLOEXEC); }
}  // namespace

bool VSAIPCListener::isValidMessageID(const VSAValue& id) {
  if (id.isInteger()) return true;
  return id.isString() && id.stringValue()->size() <= kVSAMaxMessageIDLength;
}

bool VSAIPCListener::listen(VSAErrorRef* error) {
  if (int activated = VSAActivatedListeningSocket(SOCK_STREAM, socketPath_); activated >= 0) {
    listenFd_ = activated;  // socket activation: systemd owns the file
    inherited_ = true;
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
    // A stale file (its daemon is gone) is replaced by the rename.
    listenFd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int err = listenFd_ < 0 ? errno : VSABindListeningSocket(listenFd_, socketPath_, 0666, 128);
    if (err != 0) {
      if (listenFd_ >= 0) ::close(listenFd_);
      listenFd_ = -1;
      VSASetError(error, VSA_POSIX_ERROR(err));
      return false;
    }
    ownsSocketFile_ = true;
  }
  fcntl(listenFd_, F_SETFL, fcntl(listenFd_, F_GETFL) | O_NONBLOCK);
  epollFd_ = epoll_create1(EPOLL_CLOEXEC);
  stopFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  reserveFd_ = openReserve();
  resumer_->fd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (epollFd_ < 0 || stopFd_ < 0 || reserveFd_ < 0 || resumer_->fd < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    return false;
  }
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.fd = listenFd_;
  epoll_ctl(epollFd_, EPOLL_CTL_ADD, listenFd_, &ev);
  ev.data.fd = stopFd_;
  epoll_ctl(epollFd_, EPOLL_CTL_ADD, stopFd_, &ev);
  ev.data.fd = resumer_->fd;
  epoll_ctl(epollFd_, EPOLL_CTL_ADD, resumer_->fd, &ev);
  accepting_ = true;
  return true;
}

void VSAIPCListener::setHandler(Handler handler) {
  std::lock_guard lock(handlerMutex_);
  handler_ = std::move(handler);
}

void VSAIPCListener::setRouter(Router router) {
  std::lock_guard lock(handlerMutex_);
  router_ = std::move(router);
}

void VSAIPCListener::resume() {
  if (listenFd_ < 0 || thread_.joinable()) return;
  thread_ = std::thread([this] {
    run();
    std::lock_guard lock(controlMutex_);
    threadExited_ = true;
    controlChanged_.notify_all();
  });
}

void VSAIPCListener::_onThread_stopAccepting() {
  if (listenFd_ >= 0) {
    epoll_ctl(epollFd_, EPOLL_CTL_DEL, listenFd_, nullptr);
    ::close(listenFd_);
    if (ownsSocketFile_) ::unlink(socketPath_.c_str());
  }
  listenFd_ = -1;
  accepting_ = false;
  std::lock_guard lock(peersMutex_);
  for (auto& [fd, peer] : peers_) peer->connection->setReading(false);
}

void VSAIPCListener::_onThread_holdAccepting(bool hold) {
  if (acceptHeld_ == hold) return;
  acceptHeld_ = hold;
  // While accepting is paused for want of descriptors, the sweep puts the
  // socket back once neither pause nor hold is in force.
  if (listenFd_ < 0 || acceptPaused_) return;
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.fd = listenFd_;
  epoll_ctl(epollFd_, hold ? EPOLL_CTL_DEL : EPOLL_CTL_ADD, listenFd_, &ev);
}

void VSAIPCListener::holdAccepting(bool hold) {
  std::unique_lock lock(controlMutex_);
  if (!thread_.joinable() || threadExited_) return;
  holdRequested_ = hold;
  uint64_t one = 1;
  (void)!::write(stopFd_, &one, sizeof one);
  controlChanged_.wait(lock, [&] { return held_ == hold || threadExited_; });
}

void VSAIPCListener::stopAccepting() {
  std::unique_lock lock(controlMutex_);
  if (thread_.joinable() && !threadExited_) {
    if (!acceptingStopped_) {
      stopAcceptingRequested_ = true;
      uint64_t one = 1;
      (void)!::write(stopFd_, &one, sizeof one);
      controlChanged_.wait(lock, [this] { return acceptingStopped_ || threadExited_; });
    }
    if (acceptingStopped_) return;
  }
  lock.unlock();
  _onThread_stopAccepting();  // the I/O thread is not running: nothing races
}

void VSAIPCListener::stop() {
  stopAccepting();
  if (thread_.joinable()) {
    {
      std::lock_guard lock(controlMutex_);
      stopRequested_ = true;
    }
    uint64_t one = 1;
    (void)!::write(stopFd_, &one, sizeof one);
    thread_.join();
  }
  {
    std::lock_guard lock(peersMutex_);
    for (auto& [fd, peer] : peers_) {
      // Detached first: a late reply must not touch the epoll set closed below.
      peer->connection->attachToPoller(-1);
      peer->connection->cancel();
    }
    peers_.clear();
    connectionsPerProcess_.clear();
    bufferedInput_ = 0;
  }
  {
    std::lock_guard lock(resumer_->mutex);
    if (resumer_->fd >= 0) ::close(resumer_->fd);
    resumer_->fd = -1;
    resumer_->waiting.clear();
  }
  if (epollFd_ >= 0) ::close(epollFd_);
  if (stopFd_ >= 0) ::close(stopFd_);
  if (reserveFd_ >= 0) ::close(reserveFd_);
  epollFd_ = stopFd_ = reserveFd_ = -1;
}

size_t VSAIPCListener::connectionCount() const {
  std::lock_guard lock(peersMutex_);
  return peers_.size();
}

void VSAIPCListener::run() {
  pthread_setname_np(pthread_self(), "vessa-ipc");
  // Deadlines are checked by a periodic sweep, a fraction of the shortest one.
  // Only while there is one: a peer (its frame or idle time-out) or paused
  // accepting. Without, the thread sleeps until something arrives, so an idle
  // daemon with no clients does not wake at all.
  auto interval =
      std::clamp<Clock::duration>(std::min(limits_.idleTimeout, limits_.frameTimeout) / 4,
                                  std::chrono::milliseconds(10), std::chrono::seconds(1));
  auto nextSweep = Clock::now() + interval;
  epoll_event events[64];
  for (;;) {
    bool timed = acceptPaused_ || connectionCount() > 0;
    auto wait = std::chrono::ceil<std::chrono::milliseconds>(nextSweep - Clock::now()).count();
    int n =
        epoll_wait(epollFd_, events, 64, timed ? static_cast<int>(std::max<int64_t>(wait, 0)) : -1);
    if (n < 0) {
      if (errno == EINTR) continue;
      VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "epoll_wait failed: %s",
               strerror(errno));
      return;
    }
    // A request runs inline only when its peer is the only one ready: with
    // several waiting, handing off lets this thread read the next ones while
    // a pool thread serves, so one descheduled thread cannot stall them all.
    int ready = 0;
    for (int i = 0; i < n; ++i) {
      int fd = events[i].data.fd;
      ready += fd != stopFd_ && fd != resumer_->fd && fd != listenFd_;
    }
    inlineAllowed_ = ready == 1;
    // New connections first, so that none waits behind the requests read here.
    for (int i = 0; i < n; ++i)
      if (events[i].data.fd == listenFd_ && accepting_) acceptPeers();
    for (int i = 0; i < n; ++i) {
      int fd = events[i].data.fd;
      uint32_t what = events[i].events;
      if (fd == stopFd_) {
        uint64_t count;
        (void)!::read(stopFd_, &count, sizeof count);
        std::unique_lock lock(controlMutex_);
        if (stopRequested_) return;
        if (stopAcceptingRequested_ && !acceptingStopped_) {
          lock.unlock();
          _onThread_stopAccepting();
          lock.lock();
          acceptingStopped_ = true;
          controlChanged_.notify_all();
        }
        if (holdRequested_ != held_) {
          bool hold = holdRequested_;
          lock.unlock();
          _onThread_holdAccepting(hold);
          lock.lock();
          held_ = hold;
          controlChanged_.notify_all();
        }
      } else if (fd == resumer_->fd) {
        resumePeers();
      } else if (fd == listenFd_) {
        continue;  // accepted above
      } else {
        if (what & EPOLLOUT) writePeer(fd);
        if (what & (EPOLLIN | EPOLLRDHUP | EPOLLHUP | EPOLLERR)) {
          if (accepting_) {
            readPeer(fd);
          } else if (what & (EPOLLHUP | EPOLLERR)) {
            dropPeer(fd, nullptr);  // gone while its late replies were awaited
          }
        }
      }
    }
    auto now = Clock::now();
    if (!timed) {
      nextSweep = now + interval;  // the first deadline can only begin now
    } else if (now >= nextSweep) {
      sweep(now);
      nextSweep = now + interval;
    }
  }
}

void VSAIPCListener::noteRefusal(const char* why) {
  ++refusalsSinceLog_;
  lastRefusal_ = why;
  auto now = Clock::now();
  if (now - lastRefusalLog_ < kRefusalLogInterval) return;
  VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
           "Refused %zu connection(s) in the last second; last reason: %s", refusalsSinceLog_,
           lastRefusal_);
  lastRefusalLog_ = now;
  refusalsSinceLog_ = 0;
}

bool VSAIPCListener::shedOnePeer() {
  if (reserveFd_ < 0) reserveFd_ = openReserve();
  if (reserveFd_ < 0) return false;
  ::close(reserveFd_);
  int fd = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
  if (fd >= 0) ::close(fd);
  reserveFd_ = openReserve();
  noteRefusal("out of file descriptors");
  return fd >= 0;
}

void VSAIPCListener::acceptPeers() {
  for (;;) {
    int fd = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) return;
      if (errno == EMFILE || errno == ENFILE) {
        // The peer stays queued and the socket stays readable: it must be taken
        // off the queue, or the loop would spin without serving anyone.
        if (shedOnePeer()) continue;
        if (reserveFd_ < 0) {
          noteRefusal("out of file descriptors, no reserve");
          epoll_ctl(epollFd_, EPOLL_CTL_DEL, listenFd_, nullptr);
          acceptPaused_ = true;
          acceptPausedUntil_ = Clock::now() + kAcceptPause;
        }
        return;
      }
      noteRefusal(strerror(errno));
      return;
    }
    auto token = VSAAuditToken::fromSocket(fd);
    if (!token) {
      ::close(fd);
      continue;
    }
    ProcessKey process{token->pid, token->startTime};
    if (!admit(process)) {
      ::close(fd);
      continue;
    }
    // Pins the peer's executable and identity now, before it can exec anything else.
    auto peer = std::make_unique<Peer>();
    peer->connection = std::make_shared<VSAIPCConnection>(
        fd, nextIdentifier_++, *token, registry_.get(), limits_.maxPendingOutput);
    peer->process = process;
    peer->lastFrame = Clock::now();
    VSAIPCConnection& connection = *peer->connection;
    {
      std::lock_guard lock(peersMutex_);
      ++connectionsPerProcess_[peer->process];
      peers_[fd] = std::move(peer);
    }
    epoll_event ev{};
    ev.events = EPOLLIN | EPOLLRDHUP;
    ev.data.fd = fd;
    epoll_ctl(epollFd_, EPOLL_CTL_ADD, fd, &ev);
    connection.attachToPoller(epollFd_);
  }
}

bool VSAIPCListener::admit(const ProcessKey& process) {
  auto countOf = [this](const ProcessKey& p) {
    std::lock_guard lock(peersMutex_);
    auto it = connectionsPerProcess_.find(p);
    return it == connectionsPerProcess_.end() ? size_t{0} : it->second;
  };
  auto total = [this] {
    std::lock_guard lock(peersMutex_);
    return peers_.size();
  };
  if (countOf(process) >= limits_.maxConnectionsPerProcess) {
    dropHungUpPeers(&process);
    if (countOf(process) >= limits_.maxConnectionsPerProcess) {
      noteRefusal("too many connections from one process");
      return false;
    }
  }
  if (total() >= limits_.maxConnections) {
    dropHungUpPeers(nullptr);
    if (total() >= limits_.maxConnections && !shedLargestHolder()) {
      noteRefusal("too many connections, none of them idle");
      return false;
    }
  }
  return true;
}

void VSAIPCListener::dropHungUpPeers(const ProcessKey* process) {
  std::vector<int> candidates;
  {
    std::lock_guard lock(peersMutex_);
    for (const auto& [fd, peer] : peers_)
      if (!process || peer->process == *process) candidates.push_back(fd);
  }
  for (int fd : candidates) {
    // Bytes still to read (a last request) keep it; end of stream or an error does not.
    uint8_t byte;
    ssize_t n = ::recv(fd, &byte, 1, MSG_PEEK | MSG_DONTWAIT);
    if (n == 0 || (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR))
      dropPeer(fd, nullptr);
  }
}

bool VSAIPCListener::shedLargestHolder() {
  std::vector<int> idle;
  pid_t holder = 0;
  {
    std::lock_guard lock(peersMutex_);
    auto largest =
        std::max_element(connectionsPerProcess_.begin(), connectionsPerProcess_.end(),
                         [](const auto& a, const auto& b) { return a.second < b.second; });
    if (largest == connectionsPerProcess_.end()) return false;
    holder = largest->first.first;
    for (const auto& [fd, peer] : peers_) {
      const VSAIPCConnection& c = *peer->connection;
      if (peer->process == largest->first && c.requestsInFlight() == 0 &&
          peer->reader.pending() == 0 && c.pendingOutput() == 0)
        idle.push_back(fd);
    }
  }
  for (int fd : idle) dropPeer(fd, nullptr);
  if (!idle.empty())
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Connection limit of %zu reached: closed %zu idle connections of pid %d, which held "
             "the most",
             limits_.maxConnections, idle.size(), holder);
  return !idle.empty();
}

void VSAIPCListener::dropPeer(int fd, const char* why) {
  epoll_ctl(epollFd_, EPOLL_CTL_DEL, fd, nullptr);
  std::lock_guard lock(peersMutex_);
  auto it = peers_.find(fd);
  if (it == peers_.end()) return;
  Peer& peer = *it->second;
  if (why)
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "Dropping %@: %s",
             peer.connection->description(), why);
  peer.connection->attachToPoller(-1);
  peer.connection->cancel();
  bufferedInput_ -= peer.countedInput;
  if (--connectionsPerProcess_[peer.process] == 0) connectionsPerProcess_.erase(peer.process);
  peers_.erase(it);
}

void VSAIPCListener::writePeer(int fd) {
  VSAIPCConnectionRef connection;
  {
    std::lock_guard lock(peersMutex_);
    auto it = peers_.find(fd);
    if (it == peers_.end()) return;
    connection = it->second->connection;
  }
  // A peer that went away while replies waited is an ordinary disconnect.
  if (!connection->flushPendingOutput()) dropPeer(fd, nullptr);
}

void VSAIPCListener::readPeer(int fd) {
  Peer* peer;
  {
    std::lock_guard lock(peersMutex_);
    auto it = peers_.find(fd);
    if (it == peers_.end()) return;
    peer = it->second.get();
  }
  if (peer->connection->isThrottled()) return;  // reported before its input was paused
  uint8_t buf[65536];
  // A bounded number of reads per wake-up: a peer that writes without pause
  // must not keep the thread from the others (epoll reports it again).
  for (int round = 0; round < 16; ++round) {
    ssize_t n = recv(fd, buf, sizeof buf, MSG_DONTWAIT);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return;
    if (n <= 0) {
      // A peer that goes away between frames is ordinary; inside a frame it is not.
      dropPeer(fd, n == 0 && peer->reader.pending() > 0 ? "stream ended inside a frame" : nullptr);
      return;
    }
    peer->reader.append(buf, static_cast<size_t>(n));
    if (!processFrames(fd, *peer) || peer->connection->isThrottled()) return;
  }
}

bool VSAIPCListener::processFrames(int fd, Peer& peer) {
  std::vector<uint8_t> payload;
  bool completed = false;
  for (;;) {
    VSAIPCConnection& connection = *peer.connection;
    if (connection.requestsInFlight() >= limits_.maxRequestsInFlight) {
      connection.setThrottled(true);
      // A request that ended before the flag was set did not see it: look again.
      if (connection.requestsInFlight() > limits_.maxRequestsInFlight / 2) break;
      connection.setThrottled(false);
    }
    auto status = peer.reader.next(payload);
    if (status == VSAFrameReader::Status::NeedMore) break;
    if (status == VSAFrameReader::Status::Oversized) {
      VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
               "Frame of %u bytes exceeds the limit of %u bytes", peer.reader.oversizedLength(),
               VSAFrameCodec::kMaxFrameSize);
      dropPeer(fd, "oversized frame");
      return false;
    }
    completed = true;
    std::string why;
    auto body = VSAFrameCodec::decodePayload(payload.data(), payload.size(), &why);
    if (body && body->isDictionary()) {
      const VSAValue* id = body->get(kVSAMessageIDKey);
      if (id && !isValidMessageID(*id)) {
        // A reply could not carry it back; the request is one without reply context.
        body.reset();
        why = "\"MessageID\" is neither an integer nor a string of at most 64 bytes";
      }
    }
    deliver(peer.connection, std::move(body), why);
  }
  auto now = Clock::now();
  if (completed) peer.lastFrame = now;
  size_t pending = peer.reader.pending();
  if (pending == 0) {
    peer.frameStarted = {};
  } else if (completed || peer.frameStarted == Clock::time_point{}) {
    peer.frameStarted = now;  // the first bytes of a new frame arrived in this read
  }
  bufferedInput_ = bufferedInput_ - peer.countedInput + pending;
  peer.countedInput = pending;
  if (bufferedInput_ > limits_.maxBufferedInput) {
    dropPeer(fd, "incomplete frames of all connections exceed the input budget");
    return false;
  }
  return true;
}

void VSAIPCListener::resumePeers() {
  uint64_t count;
  (void)!::read(resumer_->fd, &count, sizeof count);
  std::vector<std::weak_ptr<VSAIPCConnection>> waiting;
  {
    std::lock_guard lock(resumer_->mutex);
    waiting.swap(resumer_->waiting);
  }
  if (!accepting_) return;  // no more requests are taken in
  for (auto& weak : waiting) {
    auto connection = weak.lock();
    if (!connection || !connection->isThrottled()) continue;
    Peer* peer = nullptr;
    {
      std::lock_guard lock(peersMutex_);
      auto it = peers_.find(connection->fd());
      if (it != peers_.end() && it->second->connection == connection) peer = it->second.get();
    }
    if (!peer) continue;
    connection->setThrottled(false);
    // Frames already read come first; the socket is polled again from here on.
    processFrames(connection->fd(), *peer);
  }
}

void VSAIPCListener::sweep(Clock::time_point now) {
  if (acceptPaused_ && now >= acceptPausedUntil_ && accepting_ && listenFd_ >= 0) {
    epoll_event ev{};
    ev.events = EPOLLIN;
    ev.data.fd = listenFd_;
    if (!acceptHeld_) epoll_ctl(epollFd_, EPOLL_CTL_ADD, listenFd_, &ev);
    acceptPaused_ = false;
  }
  std::vector<std::pair<int, const char*>> expired;
  {
    std::lock_guard lock(peersMutex_);
    for (auto& [fd, peer] : peers_) {
      if (peer->connection->isThrottled() && peer->frameStarted != Clock::time_point{}) {
        peer->frameStarted = now;  // not read while paused: its frame's clock waits too
      } else if (peer->frameStarted != Clock::time_point{} &&
                 now - peer->frameStarted > limits_.frameTimeout) {
        expired.emplace_back(fd, "a frame was not completed in time");
        continue;
      }
      const VSAIPCConnection& c = *peer->connection;
      // Waiting for a late reply is not idleness; a peer that stops reading is.
      if (c.requestsInFlight() > 0) continue;
      auto active = std::max(peer->lastFrame, c.lastRequestEnded());
      if (now - active > limits_.idleTimeout) expired.emplace_back(fd, "idle for too long");
    }
  }
  for (auto& [fd, why] : expired) dropPeer(fd, why);
}

void VSAIPCListener::deliver(const VSAIPCConnectionRef& connection, std::optional<VSAValue> body,
                             std::string problem) {
  connection->requestBegan();
  // The request is in flight until it is answered, or dropped with all that
  // could still answer it (its message and its reply context).
  // A connection paused for having too many is resumed once half are done.
  std::shared_ptr<void> inFlight(nullptr, [c = connection, resumer = resumer_,
                                           resumeAt = limits_.maxRequestsInFlight / 2](void*) {
    if (c->requestEnded() <= resumeAt && c->isThrottled()) resumer->post(c);
  });
  auto message = std::make_shared<VSAIPCMessage>(connection, std::move(body), std::move(problem),
                                                 transactions_->open(), std::move(inFlight));
  Handler handler;
  Route route;
  {
    std::lock_guard lock(handlerMutex_);
    handler = handler_;
    if (router_) route = router_(message->body());
  }
  VSAWorkQueue::Ref queue = route.queue ? route.queue : queue_;
  VSAWorkQueue::Block block = [handler, message] {
    if (handler) handler(message);
  };
  if (route.runInline && inlineAllowed_) {
    // Peers that connected meanwhile are accepted, and their programs pinned,
    // before this thread is taken up by the request: the longer a connection
    // waits in the backlog, the longer its process has to exec another program.
    if (accepting_ && !acceptPaused_ && !acceptHeld_ && listenFd_ >= 0) acceptPeers();
    if (queue->runIfIdle(block)) return;
  }
  queue->async(std::move(block));
}
