// System containers are reached through the "systemusers" group alone: a
// real process that is a member can work in them, one that is not cannot.
#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "daemon/VSAClientConnection.h"

namespace fs = std::filesystem;

namespace {

constexpr gid_t kSystemUsers = 600;

// Runs `body` in a child with uid `uid`, primary group `uid` and the given
// supplementary groups; answers the child's exit status (0 = all expected).
template <typename F>
int runAs(uid_t uid, std::vector<gid_t> groups, F body) {
  pid_t pid = fork();
  if (pid == 0) {
    if (setgroups(groups.size(), groups.data()) != 0 || setgid(uid) != 0 || setuid(uid) != 0)
      _exit(100);
    _exit(body());
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 200;
}

class SystemContainerAccess : public ::testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to act as other users";
    root_ = temp_.path();
    VSAWriteMobileUser(root_);
    std::ofstream(root_ + "/etc/group") << "mobile:x:501:\nsystemusers:x:600:\n";
    context_ = std::make_unique<VSADaemonContext>(VSASystemRoot(root_));
    auto user = context_->userIdentityCache->userIdentityForPersonalPersona();
    auto client = std::make_shared<VSAClientIdentity>("com.example.installer", 0, 0, 1, user,
                                                      VSAValue::dictionary(), false,
                                                      std::array<uint8_t, 32>{}, false);
    VSAClientConnection installer(*context_, client, true, true, true, std::nullopt, std::nullopt,
                                  std::make_shared<VSACommandQueue>());
    VSAResultCode code = VSAResult::kSuccess;
    auto identity = VSAContainerIdentity::containerIdentityWithIdentifier(
        "com.example.service", VSAClass::kSystemData, *context_->userIdentityCache, &code);
    ASSERT_TRUE(identity);
    auto m = installer.createOrLookupContainerWithContainerIdentity(
        identity, {.createIfNecessary = true}, &code);
    ASSERT_TRUE(m) << code;
    container_ = m->url();
    // Only the test's own temporary directory stands in the way of others.
    fs::permissions(root_, fs::perms(0755));
  }

  VSATestTempDir temp_{"vessa-sysacl"};
  std::string root_, container_;
  std::unique_ptr<VSADaemonContext> context_;
};

TEST_F(SystemContainerAccess, MembersWorkInsideAndOthersAreKeptOut) {
  std::string library = container_ + "/Library";
  std::string caches = container_ + "/Library/Caches";
  ASSERT_TRUE(fs::is_directory(caches));
  auto work = [&]() -> int {
    int fd = ::open((caches + "/member.txt").c_str(), O_CREAT | O_WRONLY, 0600);
    if (fd < 0) return 1;
    if (::write(fd, "x", 1) != 1) return 2;
    ::close(fd);
    if (::open((caches + "/member.txt").c_str(), O_RDONLY) < 0) return 3;
    if (::mkdir((library + "/Made").c_str(), 0700) != 0) return 4;
    if (::mkdir((container_ + "/TopLevelAdd").c_str(), 0700) != 0) return 5;
    DIR* d = ::opendir(library.c_str());
    if (!d) return 6;
    ::closedir(d);
    // Shared with the group by its mode: the mask lets the entry through.
    fd = ::open((caches + "/shared.txt").c_str(), O_CREAT | O_WRONLY, 0660);
    if (fd < 0) return 7;
    ::close(fd);
    return 0;
  };
  EXPECT_EQ(runAs(700, {kSystemUsers}, work), 0) << "a member of systemusers";
  EXPECT_EQ(runAs(703, {kSystemUsers},
                  [&] {
                    int fd = ::open((caches + "/shared.txt").c_str(), O_RDWR);
                    if (fd < 0) return 1;
                    ::close(fd);
                    return ::mkdir((library + "/SecondMember").c_str(), 0700) == 0 ? 0 : 2;
                  }),
            0)
      << "another member reaches what the first shared";
  // The top level can be added to but not listed.
  EXPECT_EQ(runAs(702, {kSystemUsers},
                  [&] {
                    DIR* d = ::opendir(container_.c_str());
                    if (d) ::closedir(d);
                    return d ? 1 : 0;
                  }),
            0);
  auto stranger = [&]() -> int {
    if (::open((caches + "/stranger.txt").c_str(), O_CREAT | O_WRONLY, 0600) >= 0) return 1;
    if (::open((caches + "/member.txt").c_str(), O_RDONLY) >= 0) return 2;
    if (::mkdir((container_ + "/StrangerAdd").c_str(), 0700) == 0) return 3;
    return 0;
  };
  EXPECT_EQ(runAs(701, {}, stranger), 0) << "not a member";
  EXPECT_EQ(runAs(501, {501}, stranger), 0) << "the mobile user is not a member either";
}

}  // namespace
