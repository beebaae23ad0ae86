// End to end: a client's identity is the one fixed when its connection was
// accepted. A process that connects and then execs a registered client's
// executable, while another process keeps using the socket, must not be
// served with that client's entitlements.
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <climits>
#include <cstring>
#include <filesystem>
#include <thread>

#include "base/VSACommands.h"
#include "base/VSAPlist.h"
#include "e2e/VSATestDaemon.h"
#include "platform/VSAFrameCodec.h"

namespace {

using namespace std::chrono_literals;

const char* kAllowed = "com.tamsk.private.Vessa.allowed";

// Sends a frame and reads bytes until the reply frame is complete, the peer
// closes, or two seconds pass. Uses system calls only, so it is safe in a
// child forked from this multithreaded process.
ssize_t exchange(int fd, const std::vector<uint8_t>& request, uint8_t* reply, size_t capacity,
                 int timeoutMs = 2000) {
  if (::send(fd, request.data(), request.size(), MSG_NOSIGNAL) !=
      static_cast<ssize_t>(request.size()))
    return -1;
  size_t got = 0;
  for (;;) {
    if (got >= 4) {
      size_t length =
          (size_t(reply[0]) << 24) | (size_t(reply[1]) << 16) | (size_t(reply[2]) << 8) | reply[3];
      if (got >= 4 + length || got == capacity) return static_cast<ssize_t>(got);
    }
    pollfd pfd{fd, POLLIN, 0};
    if (poll(&pfd, 1, timeoutMs) <= 0) return static_cast<ssize_t>(got);
    ssize_t n = recv(fd, reply + got, capacity - got, 0);
    if (n <= 0) return static_cast<ssize_t>(got);
    got += static_cast<size_t>(n);
  }
}

std::optional<VSAValue> decodeReply(const uint8_t* bytes, size_t length) {
  VSAFrameReader reader;
  reader.append(bytes, length);
  std::vector<uint8_t> payload;
  if (reader.next(payload) != VSAFrameReader::Status::Frame) return std::nullopt;
  std::string why;
  return VSAFrameCodec::decodePayload(payload.data(), payload.size(), &why);
}

// Waits (up to five seconds) until process `pid` runs a program whose path
// holds `name`. System calls only, for forked children.
void waitUntilRunning(pid_t pid, const char* name) {
  char link[64], target[PATH_MAX];
  snprintf(link, sizeof link, "/proc/%d/exe", pid);
  for (int i = 0; i < 2500; ++i) {
    ssize_t len = readlink(link, target, sizeof target - 1);
    if (len > 0 && (target[len] = '\0', std::strstr(target, name))) return;
    usleep(2000);
  }
}

// Sends `request` on `fd` and writes what came back to `report` as a length
// and the bytes. System calls only.
void reportExchange(int fd, const std::vector<uint8_t>& request, int report, int timeoutMs) {
  uint8_t reply[4096];
  ssize_t n = exchange(fd, request, reply, sizeof reply, timeoutMs);
  (void)!write(report, &n, sizeof n);
  if (n > 0) (void)!write(report, reply, static_cast<size_t>(n));
}

// The next reply a connector wrote to `report`, if there was one.
std::optional<VSAValue> readReport(int report) {
  ssize_t n = -1;
  if (read(report, &n, sizeof n) != sizeof n || n <= 0) return std::nullopt;
  std::vector<uint8_t> bytes(static_cast<size_t>(n));
  size_t got = 0;
  while (got < bytes.size()) {
    ssize_t r = read(report, bytes.data() + got, bytes.size() - got);
    if (r <= 0) break;
    got += static_cast<size_t>(r);
  }
  return decodeReply(bytes.data(), got);
}

// Replaces this (forked) process with the registered sleeper.
[[noreturn]] void becomeRegisteredSleeper(const std::string& registered) {
  char arg0[] = "registered-sleeper", arg1[] = "30";
  char* argv[] = {arg0, arg1, nullptr};
  execv(registered.c_str(), argv);
  _exit(127);
}

TEST(ClientIdentity, ExecingARegisteredExecutableAfterConnectingGainsNothing) {
  VSATestDaemon d;
  // The registered client: a long-running program, so that its process is
  // alive while the socket is used behind its back.
  std::string registered = d.path("/usr/bin/registered-sleeper");
  std::filesystem::copy_file("/bin/sleep", registered);
  chmod(registered.c_str(), 0755);
  VSAErrorRef error;
  ASSERT_TRUE(VSA_writeToURL(
      VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/registered-sleeper")},
                           {"SigningIdentifier", VSAValue("com.example.sleeper")},
                           {"Entitlements", VSAValue::Dictionary{{kAllowed, VSAValue(true)}}}},
      d.path("/etc/vessad/clients.d/sleeper.plist"), 0, &error));
  ASSERT_TRUE(d.start());

  // Command 19 without an identifier: an entitled client is told 18, anyone else 55.
  auto request = *VSAFrameCodec::encode(
      VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)},
                           {"MessageID", VSAValue(1u)}},
      &error);
  std::string socketPath = d.socketPath();
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, socketPath.c_str(), sizeof addr.sun_path - 1);

  int report[2];
  ASSERT_EQ(pipe(report), 0);
  pid_t connector = fork();
  if (connector == 0) {
    // The connecting process: connects, is served once as itself, then hands
    // the socket to a child and becomes the registered program.
    ::close(report[0]);
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) _exit(2);
    reportExchange(fd, request, report[1], 2000);
    pid_t self = getpid();
    if (fork() == 0) {
      // The child waits until its parent runs the registered executable, then
      // asks again on the parent's connection.
      waitUntilRunning(self, "registered-sleeper");
      reportExchange(fd, request, report[1], 2000);
      _exit(0);
    }
    ::close(report[1]);
    becomeRegisteredSleeper(registered);
  }
  ASSERT_GT(connector, 0);
  ::close(report[1]);
  auto before = readReport(report[0]);
  auto after = readReport(report[0]);
  kill(connector, SIGKILL);
  waitpid(connector, nullptr, 0);
  ::close(report[0]);

  ASSERT_TRUE(before) << "the connecting process is served as itself";
  EXPECT_EQ(VSAReplyError(before), 55u) << "unregistered, it is not entitled";
  // After the exec, the connection is dropped: no reply, and above all never
  // the registered client's answer (18).
  EXPECT_FALSE(after) << "served after exec with ReplyError " << VSAReplyError(after);
  EXPECT_NE(VSAReplyError(after), 18u);

  // The registered program itself, connecting afresh, is entitled: the
  // check above would have seen the entitlement. (Shown with this test
  // process registered under the same entitlements.)
  d.registerSelf("com.example.self", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  EXPECT_EQ(VSAReplyError(d.request(
                VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)}})),
            18u);
  EXPECT_EQ(d.stop(), 0);
}

// A process of the mobile user connects, and execs a program registered for
// root before the daemon has accepted its connection (the daemon is not
// running yet and takes the socket over later, as under socket activation,
// or it is busy serving others); a child then asks on the inherited socket.
// Whatever the process runs by the time it is accepted, its uid is the one it
// connected with, and an entry for root never matches it.
class ExecBeforeAccept : public ::testing::TestWithParam<bool> {};

TEST_P(ExecBeforeAccept, AMobileProcessNeverBecomesAClientRegisteredForRoot) {
  bool beforeTheDaemonRuns = GetParam();
  VSATestDaemon d;
  chmod(d.root().c_str(), 0755);  // the mobile user reaches the registered program
  std::string registered = d.path("/usr/bin/registered-sleeper");
  std::filesystem::copy_file("/bin/sleep", registered);
  chmod(registered.c_str(), 0755);
  VSAErrorRef error;
  ASSERT_TRUE(VSA_writeToURL(
      VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/registered-sleeper")},
                           {"SigningIdentifier", VSAValue("com.example.sleeper")},
                           {"Entitlements", VSAValue::Dictionary{{kAllowed, VSAValue(true)}}}},
      d.path("/etc/vessad/clients.d/sleeper.plist"), 0, &error));
  d.registerSelf("com.example.busy", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  std::string socketPath = d.socketPath();
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, socketPath.c_str(), sizeof addr.sun_path - 1);
  int held = -1;
  if (beforeTheDaemonRuns) {
    held = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    ASSERT_EQ(bind(held, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    chmod(socketPath.c_str(), 0666);
    ASSERT_EQ(listen(held, 16), 0);
  } else {
    ASSERT_TRUE(d.start());
  }
  std::atomic<bool> busy{!beforeTheDaemonRuns};
  std::thread load([&] {
    while (busy)
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)}}, 2s);
  });

  auto request = *VSAFrameCodec::encode(
      VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)},
                           {"MessageID", VSAValue(1u)}},
      &error);
  int report[2];
  ASSERT_EQ(pipe(report), 0);
  pid_t connector = fork();
  if (connector == 0) {
    ::close(report[0]);
    if (setgid(501) != 0 || setuid(501) != 0) _exit(3);
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) _exit(2);
    pid_t self = getpid();
    if (fork() == 0) {
      waitUntilRunning(self, "registered-sleeper");
      reportExchange(fd, request, report[1], 15000);
      _exit(0);
    }
    ::close(report[1]);
    becomeRegisteredSleeper(registered);
  }
  ASSERT_GT(connector, 0);
  ::close(report[1]);
  if (beforeTheDaemonRuns) {
    // The program is swapped while the connection waits in the backlog; then
    // the daemon starts and takes the socket over.
    waitUntilRunning(connector, "registered-sleeper");
    std::this_thread::sleep_for(100ms);
    d.setActivationSockets({held});
    ASSERT_TRUE(d.start());
    ::close(held);
  }
  auto reply = readReport(report[0]);
  busy = false;
  load.join();
  kill(connector, SIGKILL);
  waitpid(connector, nullptr, 0);
  ::close(report[0]);
  // Never the registered client's answer (18): unentitled (55), or dropped.
  EXPECT_NE(VSAReplyError(reply), 18u);
  if (beforeTheDaemonRuns) {
    EXPECT_EQ(VSAReplyError(reply), 55u) << "accepted after the exec, as uid 501";
  }
  EXPECT_EQ(d.stop(), 0);
}

INSTANTIATE_TEST_SUITE_P(ClientIdentity, ExecBeforeAccept, ::testing::Values(true, false),
                         [](const auto& info) {
                           return info.param ? std::string("BeforeTheDaemonRuns")
                                             : std::string("WhileBusy");
                         });

}  // namespace
