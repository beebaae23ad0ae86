// The daemon under a service manager: READY=1 comes only once
// initialisation has finished, STATUS lines tell the boot work, STOPPING=1
// comes when SIGTERM begins the stop; a socket the manager holds is taken
// over (socket activation); the unit files pass systemd's own check.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "e2e/VSATestDaemon.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSAUpcallClient.h"
#include "upcall/VSAUpcallMessage.h"
#include "upcall/VSAUpcallPayload.h"

using namespace std::chrono_literals;

namespace {

// The manager's end: a datagram socket named by NOTIFY_SOCKET.
class NotifySocket {
 public:
  explicit NotifySocket(const std::string& path) : path_(path) {
    fd_ = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof(address.sun_path) - 1);
    bound_ = ::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0;
    ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
  }
  ~NotifySocket() {
    ::unsetenv("NOTIFY_SOCKET");
    ::close(fd_);
  }
  bool bound() const { return bound_; }
  // Every message received until one contains `text` or `timeout` passes.
  bool waitFor(const std::string& text, std::chrono::milliseconds timeout) {
    auto end = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < end) {
      for (const auto& m : messages_)
        if (m.find(text) != std::string::npos) return true;
      timeval tv{0, 50000};
      ::setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
      char buffer[4096];
      ssize_t n = ::recv(fd_, buffer, sizeof(buffer), 0);
      if (n > 0) messages_.emplace_back(buffer, static_cast<size_t>(n));
    }
    return false;
  }
  const std::vector<std::string>& messages() const { return messages_; }

 private:
  std::string path_;
  int fd_ = -1;
  bool bound_ = false;
  std::vector<std::string> messages_;
};

TEST(DaemonServiceManager, ReadyOnlyAfterInitialisationThenStatusAndStopping) {
  VSATestDaemon d;
  NotifySocket manager(d.root() + "/notify.sock");
  ASSERT_TRUE(manager.bound());
  VSAInitialisationHold hold(d.root());  // initialisation waits at its first step
  ASSERT_TRUE(d.start(false));
  EXPECT_FALSE(manager.waitFor("READY=1", 500ms)) << "ready before initialisation";
  hold.release();
  ASSERT_TRUE(manager.waitFor("READY=1", 10s));
  EXPECT_TRUE(manager.waitFor("STATUS=Boot setup", 1s));
  EXPECT_TRUE(manager.waitFor("boot cleanup complete", 10s));
  EXPECT_EQ(d.stop(), 0);
  EXPECT_TRUE(manager.waitFor("STOPPING=1", 1s));
  // The boot setup was announced before readiness.
  size_t setup = 0, ready = 0;
  for (size_t i = 0; i < manager.messages().size(); ++i) {
    if (manager.messages()[i].find("STATUS=Boot setup") != std::string::npos) setup = i + 1;
    if (manager.messages()[i].find("READY=1") != std::string::npos) ready = i + 1;
  }
  EXPECT_LT(setup, ready);
}

bool haveTool(const char* path) { return ::access(path, X_OK) == 0; }

TEST(DaemonServiceManager, ASocketTheManagerHoldsIsTakenOver) {
  if (!haveTool("/usr/bin/systemd-socket-activate")) GTEST_SKIP() << "no systemd-socket-activate";
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
  std::filesystem::create_directories(d.root() + "/run/vessad");
  pid_t pid = ::fork();
  if (pid == 0) {
    // The manager binds the socket and starts vessad at the first connection.
    ::execl("/usr/bin/systemd-socket-activate", "systemd-socket-activate", "-l",
            d.socketPath().c_str(), VESSAD_PATH, "--root", d.root().c_str(), nullptr);
    ::_exit(127);
  }
  for (int i = 0; i < 200 && !std::filesystem::exists(d.socketPath()); ++i)
    std::this_thread::sleep_for(20ms);
  // vessactl status starts the daemon (a connection) and gets its state.
  auto state = d.vessactl("", {"status", "--json"});
  EXPECT_EQ(state.status, 0) << state.output;
  EXPECT_NE(state.output.find("\"generation\": 1"), std::string::npos) << state.output;
  auto reply =
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kCreateOrLookup)},
                                     {"Identifier", VSAValue("com.example.app")},
                                     {"ContainerClass", VSAValue(VSAClass::kDataApplication)},
                                     {"CreateIfNecessary", VSAValue(true)}});
  EXPECT_EQ(VSAReplyError(reply), 1u);
  d.registerVessactl("installer", "com.example.installer",
                     VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
  auto found = d.vessactl("installer", {"lookup", "com.example.app"});
  EXPECT_EQ(found.status, 0) << found.output;
  ::kill(pid, SIGTERM);
  int status = 0;
  ::waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
}

namespace {
// An upcall for an app of the mobile user, sent on its own thread: the
// reply's return code, or nothing.
std::thread upcallInBackground(const std::string& path, std::optional<int32_t>* code) {
  VSAUpcallProcess app;
  app.codeSignatureID = "com.example.app";
  app.uid = 501;
  app.personaID = 1000;
  auto memory = *app.pack();
  VSAUpcallRequest request;
  request.descriptorSize = request.requestSize = static_cast<uint32_t>(memory.size());
  return std::thread([path, memory, request, code] {
    VSAUpcallClient client;
    std::string why;
    std::vector<uint8_t> reply;
    std::optional<std::vector<uint8_t>> replyMemory;
    if (client.connect(path, &why) &&
        client.call(request.bytes(), &memory, &reply, &replyMemory, &why, 20000))
      if (auto parsed = VSAUpcallReply::parse(reply.data(), reply.size()))
        *code = parsed->returnCode;
  });
}

int listeningSocket(int type, const std::string& path) {
  int fd = ::socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  if (::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 || ::listen(fd, 16) != 0)
    return -1;
  return fd;
}
}  // namespace

// The upcall's socket is there as soon as the request socket is: an upcall
// made while the daemon is still starting waits and is answered.
TEST(DaemonServiceManager, AnUpcallDuringStartUpWaitsAndIsAnswered) {
  VSATestDaemon d;
  d.registerSelfAsKernelBridge();
  VSAInitialisationHold hold(d.root());
  ASSERT_TRUE(d.start(false));
  for (int i = 0; i < 500 && !std::filesystem::exists(d.socketPath()); ++i)
    std::this_thread::sleep_for(10ms);
  ASSERT_TRUE(std::filesystem::exists(d.upcallSocketPath())) << "the upcall socket came later";
  std::optional<int32_t> code;
  auto upcall = upcallInBackground(d.upcallSocketPath(), &code);
  std::this_thread::sleep_for(300ms);
  EXPECT_FALSE(code) << "answered before start-up had finished";
  hold.release();
  upcall.join();
  EXPECT_EQ(code, std::optional<int32_t>(0));
  EXPECT_EQ(d.stop(), 0);
}

// Under socket activation the manager holds both sockets: an upcall sent
// before the daemon runs is answered once it has started, and the upcall's
// socket (which the unit makes with the request socket's mode) is root's alone.
TEST(DaemonServiceManager, BothSocketsTheManagerHoldsAreTakenOver) {
  VSATestDaemon d;
  d.registerSelfAsKernelBridge();
  int requests = listeningSocket(SOCK_STREAM, d.socketPath());
  int upcalls = listeningSocket(SOCK_SEQPACKET, d.upcallSocketPath());
  ASSERT_GE(requests, 0);
  ASSERT_GE(upcalls, 0);
  ::chmod(d.upcallSocketPath().c_str(), 0666);
  std::optional<int32_t> code;
  auto upcall = upcallInBackground(d.upcallSocketPath(), &code);
  std::this_thread::sleep_for(300ms);
  d.setActivationSockets({requests, upcalls});
  ASSERT_TRUE(d.start());
  upcall.join();
  EXPECT_EQ(code, std::optional<int32_t>(0));
  struct stat st;
  ASSERT_EQ(::stat(d.upcallSocketPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  // The request socket was taken over too (the bridge holds no entitlement).
  EXPECT_EQ(VSAReplyError(d.request(
                VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)}})),
            55u);
  EXPECT_EQ(d.stop(), 0);
  EXPECT_TRUE(std::filesystem::exists(d.upcallSocketPath())) << "the manager's file stays";
  ::close(requests);
  ::close(upcalls);
}

// With an idle period under socket activation, a daemon with nothing to do
// leaves (status 0) while the manager keeps both sockets: a client that stays
// connected keeps it, a request made after it left waits in the backlog and
// is answered by the next start, and what was made before is all there.
TEST(DaemonServiceManager, AnIdleDaemonLeavesAndTheNextStartAnswersWhatWaited) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
  int requests = listeningSocket(SOCK_STREAM, d.socketPath());
  int upcalls = listeningSocket(SOCK_SEQPACKET, d.upcallSocketPath());
  ASSERT_GE(requests, 0);
  ASSERT_GE(upcalls, 0);
  d.setActivationSockets({requests, upcalls});
  const std::vector<std::string> idle = {"--idle-exit", "1"};
  ASSERT_TRUE(d.start(true, idle));
  auto lookup = [](bool create) {
    return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kCreateOrLookup)},
                                {"Identifier", VSAValue("com.example.kept")},
                                {"ContainerClass", VSAValue(VSAClass::kDataApplication)},
                                {"CreateIfNecessary", VSAValue(create)}};
  };
  auto made = d.request(lookup(true));
  ASSERT_EQ(VSAReplyError(made), 1u);
  auto uuid = made->get("ReplyUUID")->uuidValue();
  int status = 0;
  {
    VSAIPCClient stays;
    VSAErrorRef error;
    ASSERT_TRUE(stays.connect(d.socketPath(), &error));
    EXPECT_FALSE(d.waitForExit(4s, &status)) << "a connected client keeps the daemon";
  }
  ASSERT_TRUE(d.waitForExit(10s, &status)) << "idle, it leaves";
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  EXPECT_NE(d.daemonOutput().find("Idle for 1 seconds with no client"), std::string::npos);

  // The manager's part: a connection waits on the socket it holds, and the
  // socket turning readable starts the daemon again.
  VSAIPCClient late;
  VSAErrorRef error;
  ASSERT_TRUE(late.connect(d.socketPath(), &error));
  auto id = late.send(lookup(false), &error);
  ASSERT_TRUE(id);
  pollfd readable{requests, POLLIN, 0};
  ASSERT_EQ(::poll(&readable, 1, 5000), 1);
  ASSERT_TRUE(d.start(false, idle));
  auto reply = late.waitForReply(*id, 20s, &error);
  ASSERT_EQ(VSAReplyError(reply), 1u) << "answered by the next start";
  EXPECT_EQ(reply->get("ReplyUUID")->uuidValue(), uuid) << "the container made before is kept";
  EXPECT_EQ(d.stop(), 0);
  ::close(requests);
  ::close(upcalls);
}

// Without the manager's sockets there would be nothing to start it again:
// the idle period is ignored.
TEST(DaemonServiceManager, ADaemonWithItsOwnSocketsStaysWhenIdle) {
  VSATestDaemon d;
  ASSERT_TRUE(d.start(true, {"--idle-exit", "1"}));
  int status = 0;
  EXPECT_FALSE(d.waitForExit(3s, &status));
  EXPECT_NE(d.daemonOutput().find("Staying when idle"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonServiceManager, TheUnitFilesPassSystemdsCheck) {
  if (!haveTool("/usr/bin/systemd-analyze")) GTEST_SKIP() << "no systemd-analyze";
  VSATestDaemon d;  // only for a scratch directory
  std::string dir = d.root() + "/units";
  std::filesystem::create_directories(dir);
  // The service names the installed binary; the check wants one that exists.
  std::ifstream in(std::string(VESSA_SOURCE_DIR) + "/packaging/systemd/vessad.service");
  std::string unit((std::istreambuf_iterator<char>(in)), {});
  unit.replace(unit.find("/usr/sbin/vessad"), 16, VESSAD_PATH);
  std::ofstream(dir + "/vessad.service") << unit;
  std::filesystem::copy_file(std::string(VESSA_SOURCE_DIR) + "/packaging/systemd/vessad.socket",
                             dir + "/vessad.socket");
  std::string command =
      "cd " + dir + " && systemd-analyze verify ./vessad.service ./vessad.socket 2>&1";
  FILE* pipe = ::popen(command.c_str(), "r");
  std::string output;
  char buffer[1024];
  while (size_t n = std::fread(buffer, 1, sizeof(buffer), pipe)) output.append(buffer, n);
  int status = ::pclose(pipe);
  EXPECT_EQ(status, 0) << output;
  EXPECT_EQ(output, "");
}

}  // namespace
