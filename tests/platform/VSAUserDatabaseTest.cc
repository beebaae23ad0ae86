// A root's account files: what is read from them and what is refused.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "platform/VSAUserDatabase.h"

namespace fs = std::filesystem;

namespace {
struct AccountFiles : ::testing::Test {
  VSATestTempDir dir;
  void write(const std::string& device, const std::string& text) {
    fs::create_directories(dir.path() + "/etc");
    std::ofstream(dir.path() + device) << text;
  }
  VSAUserDatabase users() { return VSAUserDatabase(VSASystemRoot(dir.path())); }
};
}  // namespace

TEST_F(AccountFiles, AccountsAreFoundByNameAndUIDAndOddLinesAreSkipped) {
  write("/etc/passwd",
        "root:x:0:0:root:/private/var/root:/bin/sh\n"
        "\n"
        "broken line without fields\n"
        "short:x:12:12\n"
        "badid:x:1x:12:gecos:/h:/bin/sh\n"
        "mobile:x:501:501::/private/var/mobile:\n"
        "last:x:777:778:no newline:/private/var/last:/bin/sh");
  write("/etc/group", "wheel:x:0:\nmobile:x:501:mobile\nstaff::20\n");
  auto db = users();
  auto mobile = db.userNamed("mobile");
  ASSERT_TRUE(mobile);
  EXPECT_EQ(mobile->uid, 501u);
  EXPECT_EQ(mobile->gid, 501u);
  EXPECT_EQ(mobile->homeDirectory, dir.path() + "/private/var/mobile");
  auto last = db.userWithUID(777);
  ASSERT_TRUE(last) << "the last line counts without its newline";
  EXPECT_EQ(last->gid, 778u);
  EXPECT_FALSE(db.userNamed("short")) << "a line with too few fields is no account";
  EXPECT_FALSE(db.userNamed("badid")) << "a uid that is not a number is no account";
  EXPECT_FALSE(db.userWithUID(12));
  EXPECT_EQ(db.groupNamed("mobile"), 501u);
  EXPECT_EQ(db.groupNamed("staff"), 20u);
  EXPECT_FALSE(db.groupNamed("nobody"));
}

TEST_F(AccountFiles, ALinkedOrOversizedAccountFileIsNotRead) {
  write("/elsewhere", "mobile:x:0:0::/:/bin/sh\n");
  fs::create_directories(dir.path() + "/etc");
  fs::create_symlink(dir.path() + "/elsewhere", dir.path() + "/etc/passwd");
  EXPECT_FALSE(users().userNamed("mobile")) << "the account file is never read through a link";
  fs::remove(dir.path() + "/etc/passwd");
  {
    std::ofstream big(dir.path() + "/etc/passwd");
    big << "mobile:x:501:501::/private/var/mobile:\n";
    big << std::string(2 << 20, '#');
  }
  EXPECT_FALSE(users().userNamed("mobile")) << "a file of megabytes is refused, not parsed";
  fs::remove(dir.path() + "/etc/passwd");
  fs::create_directory(dir.path() + "/etc/passwd");
  EXPECT_FALSE(users().userNamed("mobile"));
  EXPECT_EQ(users().homeDirectoryForUID(501), dir.path() + "/private/var/mobile")
      << "an unknown user's home is the fixed mobile home";
}
