#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "VSATestTempDir.h"
#include "base/VSAPlist.h"
#include "platform/VSAApplicationTerminationAssertion.h"

namespace fs = std::filesystem;

namespace {

class Termination : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    fs::create_directories(root_ + "/etc/vessad/clients.d");
    fs::create_directories(root_ + "/usr/bin");
    fs::create_directories(root_ + "/run/vessad");
    fs::copy_file("/bin/sleep", root_ + "/usr/bin/app");
    VSA_writeToURL(VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/app")},
                                        {"SigningIdentifier", VSAValue("com.example.app")}},
                   root_ + "/etc/vessad/clients.d/app.plist", 0, nullptr);
    VSASystemRoot root(root_);
    service_ = std::make_shared<VSAApplicationTerminationService>(
        root, std::make_shared<VSAClientRegistry>(root));
  }
  // Starts `program` (a copy of sleep) in a child; waits until it runs it.
  pid_t launch(const std::string& program) {
    pid_t pid = fork();
    if (pid == 0) {
      execl(program.c_str(), "app", "60", nullptr);
      _exit(127);
    }
    std::string exe = "/proc/" + std::to_string(pid) + "/exe";
    for (int i = 0; i < 500; ++i) {
      std::error_code ec;
      if (fs::read_symlink(exe, ec) == fs::path(program)) break;
      usleep(10000);
    }
    return pid;
  }
  // True when `pid` is still running (it is then stopped and reaped).
  static bool stillRunning(pid_t pid) {
    int status = 0;
    bool running = waitpid(pid, &status, WNOHANG) == 0;
    if (running) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
    }
    return running;
  }

  VSATestTempDir temp_{"vessa-term"};
  std::string root_;
  std::shared_ptr<VSAApplicationTerminationService> service_;
};

TEST_F(Termination, AssertionTerminatesTheAppAndHoldsItUntilInvalidated) {
  pid_t app = fork();
  if (app == 0) {
    execl((root_ + "/usr/bin/app").c_str(), "app", "60", nullptr);
    _exit(127);
  }
  usleep(100000);  // let it exec
  auto assertion = VSAApplicationTerminationAssertion::initWithBundleIdentifier(
      service_.get(), "com.example.app", 0);
  ASSERT_TRUE(assertion);
  int status = 0;
  ASSERT_EQ(waitpid(app, &status, 0), app);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL);
  EXPECT_TRUE(fs::exists(service_->recordPath("com.example.app")));
  EXPECT_TRUE(service_->isHeld("com.example.app"));
  assertion->invalidate();
  assertion->invalidate();  // harmless
  EXPECT_FALSE(fs::exists(service_->recordPath("com.example.app")));
}

TEST_F(Termination, AProcessRunningAnotherRootsCopyOfTheProgramIsLeftAlone) {
  // Another root on the same host has its own app; this root registers the
  // same program under the same identifier, reaching it through a link.
  VSATestTempDir other{"vessa-term-other"};
  fs::create_directories(other.path() + "/usr/bin");
  std::string theirs = other.path() + "/usr/bin/app";
  fs::copy_file("/bin/sleep", theirs);
  fs::create_symlink(theirs, root_ + "/usr/bin/linked-app");
  VSA_writeToURL(VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/linked-app")},
                                      {"SigningIdentifier", VSAValue("com.example.shared")}},
                 root_ + "/etc/vessad/clients.d/linked.plist", 0, nullptr);
  pid_t foreign = launch(theirs);
  pid_t own = launch(root_ + "/usr/bin/app");
  auto shared = VSAApplicationTerminationAssertion::initWithBundleIdentifier(
      service_.get(), "com.example.shared", 0);
  ASSERT_TRUE(shared);
  auto app = VSAApplicationTerminationAssertion::initWithBundleIdentifier(service_.get(),
                                                                          "com.example.app", 0);
  ASSERT_TRUE(app);
  EXPECT_TRUE(stillRunning(foreign));
  // This root's own file is matched by device and inode as before.
  int status = 0;
  ASSERT_EQ(waitpid(own, &status, 0), own);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL);
  shared->invalidate();
  app->invalidate();
}

TEST_F(Termination, AHoldThatCannotBeRecordedGivesNoAssertion) {
  // Something that is not a file stands where the record goes.
  std::string record = service_->recordPath("com.example.app");
  fs::create_directories(record + "/occupied");
  pid_t app = launch(root_ + "/usr/bin/app");
  auto refused = VSAApplicationTerminationAssertion::initWithBundleIdentifier(service_.get(),
                                                                              "com.example.app", 0);
  EXPECT_FALSE(refused);
  if (refused) refused->invalidate();
  EXPECT_FALSE(service_->isHeld("com.example.app"));
  EXPECT_TRUE(fs::is_directory(record + "/occupied"));
  // No hold, so nothing was terminated on its behalf.
  EXPECT_TRUE(stillRunning(app));
  // Once the record can be written, the assertion is given.
  fs::remove_all(record);
  auto assertion = VSAApplicationTerminationAssertion::initWithBundleIdentifier(
      service_.get(), "com.example.app", 0);
  ASSERT_TRUE(assertion);
  EXPECT_TRUE(service_->isHeld("com.example.app"));
  assertion->invalidate();
}

TEST_F(Termination, UnavailableServiceAndBadNamesGiveNoAssertion) {
  EXPECT_FALSE(VSAApplicationTerminationAssertion::initWithBundleIdentifier(nullptr, "com.x", 0));
  EXPECT_FALSE(
      VSAApplicationTerminationAssertion::initWithBundleIdentifier(service_.get(), "../x", 0));
  for (const char* name : {"", ".", "..", "a/b", ".hidden"})
    EXPECT_FALSE(
        VSAApplicationTerminationAssertion::initWithBundleIdentifier(service_.get(), name, 0))
        << name;
  EXPECT_FALSE(VSAApplicationTerminationAssertion::initWithBundleIdentifier(
      service_.get(), std::string(300, 'a'), 0));
  EXPECT_FALSE(fs::exists(root_ + "/run/vessad/x"));
}

TEST_F(Termination, MisuseEndsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        auto a = VSAApplicationTerminationAssertion::initWithBundleIdentifier(service_.get(),
                                                                              "com.x", 1);
        a.reset();  // released while held
      },
      "nil == self.termAssertion");
  EXPECT_DEATH(
      VSAApplicationTerminationAssertion::initWithBundleIdentifier(service_.get(), "com.x", 2),
      "Invalid termination reason");
}

}  // namespace
