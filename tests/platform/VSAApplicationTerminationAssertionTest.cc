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

TEST_F(Termination, UnavailableServiceAndBadNamesGiveNoAssertion) {
  EXPECT_FALSE(VSAApplicationTerminationAssertion::initWithBundleIdentifier(nullptr, "com.x", 0));
  EXPECT_FALSE(
      VSAApplicationTerminationAssertion::initWithBundleIdentifier(service_.get(), "../x", 0));
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
