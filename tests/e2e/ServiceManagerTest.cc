// The daemon under a service manager: READY=1 comes only once
// initialisation has finished, STATUS lines tell the boot work, STOPPING=1
// comes when SIGTERM begins the stop; a socket the manager holds is taken
// over (socket activation); the unit files pass systemd's own check.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "e2e/VSATestDaemon.h"

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
  auto reply = d.request(VSAValue::Dictionary{{"Command", VSAValue(0u)},
                                              {"Identifier", VSAValue("com.example.app")},
                                              {"ContainerClass", VSAValue(2u)},
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
