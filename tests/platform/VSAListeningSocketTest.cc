// A listening socket appears at its path only once it accepts connections.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "platform/VSAListeningSocket.h"

namespace fs = std::filesystem;

namespace {

class VSAListeningSocketTest : public ::testing::Test {
 protected:
  void SetUp() override { fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0); }
  void TearDown() override { ::close(fd_); }
  bool connects(const std::string& path) {
    int c = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
    bool ok = ::connect(c, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) == 0;
    ::close(c);
    return ok;
  }
  size_t entries() {
    size_t n = 0;
    for (auto& e : fs::directory_iterator(dir_)) (void)e, ++n;
    return n;
  }
  VSATestTempDir temp_{"vessa-sock"};
  const std::string& dir_ = temp_.path();
  int fd_ = -1;
};

TEST_F(VSAListeningSocketTest, ThePathAppearsListeningWithItsModeAndReplacesAStaleFile) {
  std::string path = dir_ + "/service";
  std::ofstream(path) << "stale";
  ASSERT_EQ(VSABindListeningSocket(fd_, path, 0600, 4), 0);
  struct stat st;
  ASSERT_EQ(::lstat(path.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_TRUE(connects(path));  // no window between the file and listen()
  EXPECT_EQ(entries(), 1u);     // no temporary name left
}

TEST_F(VSAListeningSocketTest, FailuresLeaveNothingAndDoNotTouchThePath) {
  EXPECT_EQ(VSABindListeningSocket(fd_, dir_ + "/missing/service", 0666, 4), ENOENT);
  EXPECT_EQ(entries(), 0u);
  // A name whose temporary sibling would not fit an address: refused before
  // anything is made, and a file already there stays.
  std::string longPath = dir_ + "/" + std::string(100 - dir_.size(), 's');
  std::ofstream(longPath) << "kept";
  EXPECT_EQ(VSABindListeningSocket(fd_, longPath, 0666, 4), ENAMETOOLONG);
  EXPECT_TRUE(fs::is_regular_file(longPath));
  EXPECT_EQ(entries(), 1u);
}

}  // namespace
