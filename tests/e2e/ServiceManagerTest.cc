// The daemon under a service manager that waits for readiness: READY=1 comes
// only once initialisation has finished, STATUS lines tell the boot work,
// and STOPPING=1 comes when SIGTERM begins the stop.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <string>
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

}  // namespace
