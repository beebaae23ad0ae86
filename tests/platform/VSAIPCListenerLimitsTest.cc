// The listener's resource bounds: replies never wait for a slow reader,
// per-connection output, connections per process and overall, descriptor exhaustion, frame and
// idle time-outs, the input budget and the "MessageID" rule.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <thread>
#include <vector>

#include "VSATestTempDir.h"
#include "platform/VSAFrameCodec.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSAIPCListener.h"

namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

std::vector<uint8_t> frameOf(const VSAValue& v) {
  VSAErrorRef error;
  return *VSAFrameCodec::encode(v, &error);
}

int connectRaw(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  if (fd >= 0 && connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

bool sendAll(int fd, const std::vector<uint8_t>& bytes, size_t from = 0, size_t to = SIZE_MAX) {
  to = std::min(to, bytes.size());
  while (from < to) {
    ssize_t n = ::send(fd, bytes.data() + from, to - from, MSG_NOSIGNAL);
    if (n <= 0) return false;
    from += static_cast<size_t>(n);
  }
  return true;
}

// The next frame on `fd`; nothing at end of stream or after `timeout`.
// `closed` tells which.
std::optional<VSAValue> readFrame(int fd, std::chrono::milliseconds timeout,
                                  bool* closed = nullptr) {
  VSAFrameReader reader;
  auto deadline = Clock::now() + timeout;
  if (closed) *closed = false;
  std::vector<uint8_t> payload;
  for (;;) {
    if (reader.next(payload) == VSAFrameReader::Status::Frame) {
      std::string why;
      return VSAFrameCodec::decodePayload(payload.data(), payload.size(), &why);
    }
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) return std::nullopt;
    pollfd pfd{fd, POLLIN, 0};
    if (poll(&pfd, 1, static_cast<int>(left.count())) <= 0) continue;
    // One byte at a time: bytes after this frame stay in the socket for the next call.
    uint8_t b;
    ssize_t n = recv(fd, &b, 1, 0);
    if (n <= 0) {
      if (closed) *closed = true;
      return std::nullopt;
    }
    reader.append(&b, 1);
  }
}

// True when the other end closed `fd` within `timeout` (data before the end is skipped).
bool closedWithin(int fd, std::chrono::milliseconds timeout) {
  auto deadline = Clock::now() + timeout;
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) return false;
    pollfd pfd{fd, POLLIN, 0};
    if (poll(&pfd, 1, static_cast<int>(left.count())) <= 0) continue;
    uint8_t buf[4096];
    if (recv(fd, buf, sizeof buf, 0) <= 0) return true;
  }
}

double cpuSeconds() {
  rusage ru{};
  getrusage(RUSAGE_SELF, &ru);
  return ru.ru_utime.tv_sec + ru.ru_stime.tv_sec +
         (ru.ru_utime.tv_usec + ru.ru_stime.tv_usec) / 1e6;
}

class VSAIPCListenerLimitsTest : public ::testing::Test {
 protected:
  void start(std::optional<VSAIPCListenerLimits> limits = std::nullopt) {
    path_ = dir_.path() + "/sock";
    queue_ = VSAWorkQueue::create("test.listener.limits");
    transactions_ = std::make_shared<VSATransactions>();
    listener_ =
        limits ? std::make_unique<VSAIPCListener>(path_, queue_, transactions_, nullptr, *limits)
               : std::make_unique<VSAIPCListener>(path_, queue_, transactions_);
    VSAErrorRef error;
    ASSERT_TRUE(listener_->listen(&error)) << error->localizedDescription();
    // Echo handler; a "Hold" value keeps the request in flight that many milliseconds.
    listener_->setHandler([this](const VSAIPCMessageRef& m) {
      ++received_;
      if (!m->hasReplyContext()) {
        std::lock_guard lock(mutex_);
        problems_.push_back(m->problem());
        m->connection()->cancel();
        return;
      }
      if (auto hold = m->body().get("Hold"))
        std::this_thread::sleep_for(std::chrono::milliseconds(*hold->int64Value()));
      VSAValue reply = *m->createReply();
      if (auto v = m->body().get("Value")) reply.set("Echo", *v);
      m->sendReply(reply);
    });
    listener_->resume();
  }
  void TearDown() override {
    if (listener_) listener_->stop();
  }
  // Waits until the listener holds `count` connections.
  bool waitForConnections(size_t count, std::chrono::milliseconds timeout) {
    auto deadline = Clock::now() + timeout;
    while (listener_->connectionCount() != count) {
      if (Clock::now() > deadline) return false;
      std::this_thread::sleep_for(5ms);
    }
    return true;
  }

  VSATestTempDir dir_{"vessa-limits"};
  std::string path_;
  VSAWorkQueue::Ref queue_;
  std::shared_ptr<VSATransactions> transactions_;
  std::unique_ptr<VSAIPCListener> listener_;
  std::atomic<int> received_{0};
  std::mutex mutex_;
  std::vector<std::string> problems_;
};

// Voluntary context switches of this process's threads named `name`.
long wakeUps(const char* name) {
  long total = 0;
  for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
    std::ifstream comm(task.path() / "comm");
    std::string threadName;
    std::getline(comm, threadName);
    if (threadName != name) continue;
    std::ifstream status(task.path() / "status");
    for (std::string line; std::getline(status, line);)
      if (line.rfind("voluntary_ctxt_switches:", 0) == 0) total += std::stol(line.substr(24));
  }
  return total;
}

TEST_F(VSAIPCListenerLimitsTest, WithNoPeerTheListenerSleepsAndWithOneItsTimeOutsStillRun) {
  VSAIPCListenerLimits limits;
  limits.idleTimeout = 400ms;  // swept every 100 ms while a peer is there
  start(limits);
  std::this_thread::sleep_for(100ms);
  long before = wakeUps("vessa-ipc");
  std::this_thread::sleep_for(1500ms);
  EXPECT_EQ(wakeUps("vessa-ipc") - before, 0) << "no client, no deadline: no wake-up";
  int fd = connectRaw(path_);
  ASSERT_GE(fd, 0);
  EXPECT_TRUE(closedWithin(fd, 3000ms)) << "an idle peer is still dropped on time";
  ::close(fd);
  ASSERT_TRUE(waitForConnections(0, 1000ms));
  std::this_thread::sleep_for(100ms);
  before = wakeUps("vessa-ipc");
  std::this_thread::sleep_for(1000ms);
  EXPECT_EQ(wakeUps("vessa-ipc") - before, 0) << "asleep again once the peer is gone";
}

TEST_F(VSAIPCListenerLimitsTest, AClientThatNeverReadsDoesNotDelayOthers) {
  start();
  VSAErrorRef error;
  VSAIPCClient silent, other;
  ASSERT_TRUE(silent.connect(path_, &error));
  ASSERT_TRUE(other.connect(path_, &error));
  // Far more replies than the socket buffers hold: once they are full, a reply
  // to the silent client can only wait for it.
  constexpr int kFlood = 10000;
  std::vector<uint64_t> ids;
  std::thread flood([&] {
    for (int i = 0; i < kFlood; ++i) {
      auto id = silent.send(VSAValue::Dictionary{{"Value", VSAValue(i)}}, nullptr);
      if (!id) break;
      ids.push_back(*id);
    }
  });
  // The other client is answered promptly all along, while the silent one
  // reads nothing for six seconds.
  auto end = Clock::now() + 6s;
  int asked = 0;
  while (Clock::now() < end) {
    auto t0 = Clock::now();
    auto reply = other.sendRequest(VSAValue::Dictionary{{"Value", VSAValue(asked)}}, 2s, &error);
    if (!reply) {
      ADD_FAILURE() << "request " << asked << " was not answered within 2 s";
      break;
    }
    EXPECT_EQ(reply->get("Echo")->int64Value(), asked);
    EXPECT_LT(Clock::now() - t0, 2s);
    ++asked;
    std::this_thread::sleep_for(100ms);
  }
  flood.join();
  if (HasFailure()) return;
  ASSERT_EQ(ids.size(), static_cast<size_t>(kFlood));
  EXPECT_EQ(listener_->connectionCount(), 2u) << "a backlog within the bound is kept";
  // The held-back replies all arrive, in order, once the client reads.
  for (int i = 0; i < kFlood; ++i) {
    auto reply = silent.waitForReply(ids[i], 5s, &error);
    ASSERT_TRUE(reply) << "reply " << i;
    ASSERT_EQ(reply->get("Echo")->int64Value(), i);
  }
}

TEST_F(VSAIPCListenerLimitsTest, AReplyBacklogOverTheBoundDropsTheConnection) {
  VSAIPCListenerLimits limits;
  limits.maxPendingOutput = 64 << 10;
  start(limits);
  VSAErrorRef error;
  VSAIPCClient silent, other;
  ASSERT_TRUE(silent.connect(path_, &error));
  ASSERT_TRUE(other.connect(path_, &error));
  for (int i = 0; i < 20000; ++i)
    if (!silent.send(VSAValue::Dictionary{{"Value", VSAValue(i)}}, nullptr)) break;
  ASSERT_TRUE(waitForConnections(1, 10s)) << "the silent client is dropped";
  EXPECT_TRUE(silent.waitForClose(5s));
  auto reply = other.sendRequest(VSAValue::Dictionary{{"Value", VSAValue("ok")}}, 2s, &error);
  ASSERT_TRUE(reply);
  EXPECT_EQ(*reply->get("Echo")->stringValue(), "ok");
}

TEST_F(VSAIPCListenerLimitsTest, APeerWithTooManyRequestsInFlightIsNotReadUntilHalfAreDone) {
  VSAIPCListenerLimits limits;
  limits.maxRequestsInFlight = 4;
  start(limits);
  VSAErrorRef error;
  VSAIPCClient client;
  ASSERT_TRUE(client.connect(path_, &error));
  // Every message holds a transaction from its receipt to its reply, so the
  // open transactions are the requests taken in and not yet finished.
  std::atomic<bool> done{false};
  std::atomic<int> most{0};
  std::thread sampler([&] {
    while (!done) {
      int open = transactions_->openCount();
      if (open > most) most = open;
      std::this_thread::sleep_for(200us);
    }
  });
  constexpr int kRequests = 60;
  std::vector<uint64_t> ids;
  for (int i = 0; i < kRequests; ++i) {
    auto id =
        client.send(VSAValue::Dictionary{{"Value", VSAValue(i)}, {"Hold", VSAValue(10)}}, &error);
    ASSERT_TRUE(id);
    ids.push_back(*id);
  }
  bool all = true;
  for (int i = 0; i < kRequests && all; ++i) {
    auto reply = client.waitForReply(ids[i], 5s, &error);
    all = reply && reply->get("Echo")->int64Value() == i;
  }
  done = true;
  sampler.join();
  EXPECT_TRUE(all) << "every request is answered, in order, once the peer is read again";
  EXPECT_GE(most.load(), 2) << "the sampler saw requests in flight";
  EXPECT_LE(most.load(), 4) << "requests taken in at once";
}

TEST_F(VSAIPCListenerLimitsTest, MessageIDIsAnIntegerOrAShortString) {
  start();
  struct Case {
    VSAValue id;
    bool served;
  };
  std::vector<Case> cases = {
      {VSAValue(int64_t(-5)), true},
      {VSAValue(UINT64_MAX), true},
      {VSAValue(std::string(64, 'x')), true},
      {VSAValue(std::string(65, 'x')), false},
      {VSAValue(std::vector<uint8_t>(16, 1)), false},
      {VSAValue(VSAValue::Dictionary{{"a", VSAValue(1)}}), false},
      {VSAValue(1.5), false},
  };
  for (auto& c : cases) {
    int fd = connectRaw(path_);
    ASSERT_GE(fd, 0);
    ASSERT_TRUE(
        sendAll(fd, frameOf(VSAValue::Dictionary{{"MessageID", c.id}, {"Value", VSAValue(7)}})));
    bool closed = false;
    auto reply = readFrame(fd, 2s, &closed);
    if (c.served) {
      ASSERT_TRUE(reply) << c.id.description();
      EXPECT_EQ(*reply->get("MessageID"), c.id);
      EXPECT_EQ(reply->get("Echo")->int64Value(), 7);
    } else {
      EXPECT_FALSE(reply) << c.id.description();
      EXPECT_TRUE(closed) << c.id.description();
    }
    ::close(fd);
  }
  std::lock_guard lock(mutex_);
  ASSERT_EQ(problems_.size(), 4u);
  for (auto& p : problems_) EXPECT_NE(p.find("MessageID"), std::string::npos) << p;
}

// In a forked child: connects, sends `frame`, and exits 0 when the echo came.
// System calls only: the parent has threads.
pid_t echoFromAnotherProcess(const std::string& path, const std::vector<uint8_t>& frame) {
  pid_t child = fork();
  if (child != 0) return child;
  int fd = connectRaw(path);
  if (fd < 0 || !sendAll(fd, frame)) _exit(2);
  uint8_t buf[4096];
  pollfd pfd{fd, POLLIN, 0};
  if (poll(&pfd, 1, 5000) <= 0 || recv(fd, buf, sizeof buf, 0) <= 4) _exit(1);
  _exit(0);
}

int exitStatus(pid_t child) {
  int status = -1;
  waitpid(child, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Every app runs as the same uid: the bound is per process, another process
// is not refused for it, and connections closed a moment ago do not count.
TEST_F(VSAIPCListenerLimitsTest, ConnectionsPerProcessAreCapped) {
  VSAIPCListenerLimits limits;
  limits.maxConnectionsPerProcess = 4;
  start(limits);
  std::vector<int> fds;
  for (int i = 0; i < 6; ++i) {
    fds.push_back(connectRaw(path_));
    ASSERT_GE(fds.back(), 0);
    // One at a time, so that the order of acceptance is the order here.
    if (i < 4) {
      ASSERT_TRUE(waitForConnections(i + 1, 2s));
    }
  }
  for (int i = 0; i < 6; ++i) {
    // The send may already fail on a refused connection; what matters is the answer.
    bool sent = sendAll(fds[i], frameOf(VSAValue::Dictionary{{"Value", VSAValue(i)}}));
    bool closed = false;
    auto reply = readFrame(fds[i], 2s, &closed);
    if (i < 4) {
      ASSERT_TRUE(sent) << i;
      ASSERT_TRUE(reply) << i;
      EXPECT_EQ(reply->get("Echo")->int64Value(), i);
    } else {
      EXPECT_TRUE(closed) << "connection " << i << " is over the cap";
    }
  }
  EXPECT_EQ(listener_->connectionCount(), 4u);
  // Another process of the same uid is served meanwhile.
  EXPECT_EQ(exitStatus(echoFromAnotherProcess(path_, frameOf(VSAValue::Dictionary{}))), 0);
  // Closed and reopened at once, before the listener saw the closes: all admitted.
  for (int round = 0; round < 20; ++round) {
    for (int i = 0; i < 4; ++i) {
      ::close(fds[i]);
      fds[i] = connectRaw(path_);
    }
    for (int i = 0; i < 4; ++i) {
      ASSERT_TRUE(sendAll(fds[i], frameOf(VSAValue::Dictionary{{"Value", VSAValue(i)}})));
      auto reply = readFrame(fds[i], 2s);
      ASSERT_TRUE(reply) << "round " << round << ", connection " << i;
    }
  }
  for (int fd : fds) ::close(fd);
}

// At the bound over all processes, the process holding the most gives up its
// idle connections; the newcomer and the others are served.
TEST_F(VSAIPCListenerLimitsTest, AtTheOverallBoundTheLargestHolderMakesRoom) {
  VSAIPCListenerLimits limits;
  limits.maxConnections = 6;
  start(limits);
  std::vector<int> hoard;
  for (int i = 0; i < 5; ++i) {
    hoard.push_back(connectRaw(path_));
    ASSERT_TRUE(waitForConnections(hoard.size(), 2s));
  }
  int busy = connectRaw(path_);  // one of the hoarder's, with a request in progress
  ASSERT_TRUE(waitForConnections(6, 2s));
  ASSERT_TRUE(sendAll(busy, frameOf(VSAValue::Dictionary{{"Value", VSAValue(7)},
                                                         {"Hold", VSAValue(int64_t{1500})}})));
  std::this_thread::sleep_for(200ms);
  pid_t other = echoFromAnotherProcess(path_, frameOf(VSAValue::Dictionary{}));
  for (int fd : hoard) EXPECT_TRUE(closedWithin(fd, 5s)) << "an idle connection of the hoarder";
  auto reply = readFrame(busy, 5s);
  ASSERT_TRUE(reply) << "the connection with a request in progress stays";
  EXPECT_EQ(reply->get("Echo")->int64Value(), 7);
  EXPECT_EQ(exitStatus(other), 0) << "the newcomer is served";
  for (int fd : hoard) ::close(fd);
  ::close(busy);
}

TEST_F(VSAIPCListenerLimitsTest, OutOfDescriptorsTheExcessIsShedWithoutSpinning) {
  start();
  VSAErrorRef error;
  VSAIPCClient existing;
  ASSERT_TRUE(existing.connect(path_, &error));
  ASSERT_TRUE(existing.sendRequest(VSAValue::Dictionary{{"Value", VSAValue(0)}}, 2s, &error));

  rlimit saved{};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
  size_t open = 0;
  for ([[maybe_unused]] auto& e : std::filesystem::directory_iterator("/proc/self/fd")) ++open;
  int report[2];
  ASSERT_EQ(pipe(report), 0);
  // Room for a handful of connections, then the process is out of descriptors.
  rlimit low = saved;
  low.rlim_cur = open + 8;
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &low), 0);

  constexpr int kPeers = 100;
  pid_t child = fork();
  if (child == 0) {
    // The peers live in their own process, with the descriptors they need.
    setrlimit(RLIMIT_NOFILE, &saved);
    int fds[kPeers];
    for (int& fd : fds) fd = connectRaw(path_);
    // Count the connections the listener closes within three seconds.
    int closed = 0;
    bool seen[kPeers] = {};
    for (int round = 0; round < 300; ++round) {
      for (int i = 0; i < kPeers; ++i) {
        if (seen[i] || fds[i] < 0) continue;
        uint8_t b;
        ssize_t n = recv(fds[i], &b, 1, MSG_DONTWAIT);
        if (n == 0 || (n < 0 && errno != EAGAIN)) {
          seen[i] = true;
          ++closed;
        }
      }
      usleep(10000);
    }
    (void)!write(report[1], &closed, sizeof closed);
    _exit(0);
  }
  ASSERT_GT(child, 0);
  double cpuBefore = cpuSeconds();
  std::this_thread::sleep_for(1500ms);
  double cpu = cpuSeconds() - cpuBefore;
  // The connected client is still served while the excess waits to be shed.
  auto reply = existing.sendRequest(VSAValue::Dictionary{{"Value", VSAValue(1)}}, 2s, &error);
  int closed = -1;
  (void)!read(report[0], &closed, sizeof closed);
  waitpid(child, nullptr, 0);
  setrlimit(RLIMIT_NOFILE, &saved);
  ::close(report[0]);
  ::close(report[1]);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->get("Echo")->int64Value(), 1);
  // A listener that kept retrying accept would burn a whole core here.
  EXPECT_LT(cpu, 0.5) << "CPU seconds used in 1.5 s while out of descriptors";
  EXPECT_GE(closed, kPeers - 10) << "the peers beyond the limit are closed, not left waiting";
}

TEST_F(VSAIPCListenerLimitsTest, AnIncompleteFrameTimesOut) {
  VSAIPCListenerLimits limits;
  limits.frameTimeout = 300ms;
  start(limits);
  int slow = connectRaw(path_), quiet = connectRaw(path_);
  ASSERT_GE(slow, 0);
  ASSERT_GE(quiet, 0);
  auto frame = frameOf(VSAValue::Dictionary{{"Value", VSAValue(std::string(1000, 'v'))}});
  auto t0 = Clock::now();
  ASSERT_TRUE(sendAll(slow, frame, 0, frame.size() / 2));
  EXPECT_TRUE(closedWithin(slow, 3s));
  EXPECT_GE(Clock::now() - t0, 250ms);
  // A connection between frames is not concerned by the frame time-out.
  ASSERT_TRUE(waitForConnections(1, 2s));
  ASSERT_TRUE(sendAll(quiet, frameOf(VSAValue::Dictionary{{"Value", VSAValue(3)}})));
  auto reply = readFrame(quiet, 2s);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->get("Echo")->int64Value(), 3);
  ::close(slow);
  ::close(quiet);
}

TEST_F(VSAIPCListenerLimitsTest, AnIdleConnectionTimesOutButNotOneAwaitingItsReply) {
  VSAIPCListenerLimits limits;
  limits.idleTimeout = 300ms;
  start(limits);
  int idle = connectRaw(path_), waiting = connectRaw(path_);
  ASSERT_GE(idle, 0);
  ASSERT_GE(waiting, 0);
  // This request is held for a second, well past the idle time-out.
  ASSERT_TRUE(sendAll(
      waiting, frameOf(VSAValue::Dictionary{{"Value", VSAValue(5)}, {"Hold", VSAValue(1000)}})));
  EXPECT_TRUE(closedWithin(idle, 3s));
  auto reply = readFrame(waiting, 3s);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->get("Echo")->int64Value(), 5);
  // Once answered and silent, it is idle too.
  EXPECT_TRUE(closedWithin(waiting, 3s));
  ::close(idle);
  ::close(waiting);
}

TEST_F(VSAIPCListenerLimitsTest, TheInputBudgetDropsTheConnectionThatExceedsIt) {
  VSAIPCListenerLimits limits;
  limits.maxBufferedInput = 1 << 20;
  start(limits);
  int first = connectRaw(path_), second = connectRaw(path_);
  ASSERT_GE(first, 0);
  ASSERT_GE(second, 0);
  auto big = frameOf(VSAValue::Dictionary{
      {"Value", VSAValue(7)}, {"Data", VSAValue(std::vector<uint8_t>(800 << 10, 0xAB))}});
  constexpr size_t kPart = 700 << 10;
  ASSERT_TRUE(sendAll(first, big, 0, kPart));
  std::this_thread::sleep_for(300ms);  // taken in before the second one starts
  // 700 KiB more would hold 1.4 MiB of incomplete frames: over the budget.
  sendAll(second, big, 0, kPart);
  EXPECT_TRUE(closedWithin(second, 3s));
  // The first connection, within the budget, completes its frame and is served.
  ASSERT_TRUE(sendAll(first, big, kPart));
  auto reply = readFrame(first, 3s);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->get("Echo")->int64Value(), 7);
  ::close(first);
  ::close(second);
}

}  // namespace
