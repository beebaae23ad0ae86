// End to end: test locks that freeze the real daemon (and the command that
// releases them getting through while it is frozen), a daemon killed while
// frozen inside a creation, the crash-retry test across real crashes, and
// the commands that name content inside containers.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <future>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "base/VSAUUID.h"
#include "e2e/VSATestDaemon.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace {

const char* kAllowed = "com.tamsk.private.Vessa.allowed";
const char* kTestability = "com.tamsk.private.Vessa.testability";

VSAValue request(VSACommandNumber command, const char* id,
                 VSAContainerClass containerClass = VSAClass::kDataApplication) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)},
                              {"Identifier", VSAValue(id)},
                              {"ContainerClass", VSAValue(containerClass)}};
}
VSAValue with(VSAValue body, const char* key, VSAValue value) {
  body.set(key, std::move(value));
  return body;
}
VSAValue testLock(uint64_t lock, bool enable) {
  return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kTestLock)},
                              {"TestLock", VSAValue(lock)},
                              {"Enable", VSAValue(enable)}};
}
VSAValue create(const char* id, VSAContainerClass containerClass = VSAClass::kDataApplication) {
  return with(request(VSACommands::kCreateOrLookup, id, containerClass), "CreateIfNecessary",
              VSAValue(true));
}
void markInternal(VSATestDaemon& d) {
  std::ofstream(d.path("/etc/vessad/device.plist"))
      << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
         "<key>HasInternalContent</key><true/></dict></plist>\n";
}
size_t entries(const std::string& dir) {
  if (!fs::exists(dir)) return 0;
  return static_cast<size_t>(std::distance(fs::directory_iterator(dir), {}));
}
size_t occurrences(const std::string& text, const char* what) {
  size_t count = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++count;
  return count;
}
template <typename Predicate>
bool eventually(Predicate p, std::chrono::milliseconds limit = 10s) {
  auto deadline = std::chrono::steady_clock::now() + limit;
  while (!p()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(10ms);
  }
  return true;
}

class Testability : public ::testing::Test {
 protected:
  void SetUp() override {
    markInternal(d);
    d.registerSelf("com.example.tester", VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                                                              {kTestability, VSAValue(true)}});
    ASSERT_TRUE(d.start());
  }
  std::future<std::optional<VSAValue>> later(VSAValue body) {
    return std::async(std::launch::async, [this, body] { return d.request(body, 20s); });
  }
  std::string staging() { return d.path("/private/var/mobile/Containers/Staging"); }
  VSATestDaemon d;
};

TEST_F(Testability, AFrozenDaemonStillTakesTheCommandThatReleasesIt) {
  EXPECT_EQ(VSAReplyError(d.request(testLock(7, true))), 38u);
  EXPECT_EQ(VSAReplyError(d.request(testLock(99, false))), 38u);
  ASSERT_EQ(VSAReplyError(d.request(testLock(0, true))), 1u);
  ASSERT_EQ(VSAReplyError(d.request(testLock(0, true))), 1u);  // held once
  auto blocked = later(create("com.example.app"));
  EXPECT_EQ(blocked.wait_for(500ms), std::future_status::timeout);
  // Behind it on the listener queue.
  auto queued = later(request(VSACommands::kDiskUsage, "com.example.app"));
  EXPECT_EQ(queued.wait_for(200ms), std::future_status::timeout);
  // One release suffices; the frozen creation then finishes, and the
  // request after it sees the container.
  ASSERT_EQ(VSAReplyError(d.request(testLock(0, false))), 1u);
  EXPECT_EQ(VSAReplyError(blocked.get()), 1u);
  EXPECT_EQ(VSAReplyError(queued.get()), 1u);

  // Lock 6 stops a cache rebuild: a class not yet cached (plug-in data).
  ASSERT_EQ(VSAReplyError(d.request(testLock(6, true))), 1u);
  auto rebuild = later(create("com.example.plugin", VSAClass::kDataPlugin));
  EXPECT_EQ(rebuild.wait_for(500ms), std::future_status::timeout);
  ASSERT_EQ(VSAReplyError(d.request(testLock(7, false))), 1u);  // everything off
  EXPECT_EQ(VSAReplyError(rebuild.get()), 1u);
  EXPECT_NE(d.daemonOutput().find("Waiting on lock: 6"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

// Lock 0 cannot be had while a wipe frozen at lock 3 holds its identifier
// lock: taking it waits, but the release of lock 3 (which lets it through)
// and a stop of the daemon never wait behind it.
TEST_F(Testability, TakingLockZeroBehindAFrozenWipeNeverHoldsUpReleasesOrAStop) {
  const char* wipeEntitlement = "com.tamsk.private.Vessa.wipeContainer";
  d.registerSelf("com.example.tester", VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                                                            {kTestability, VSAValue(true)},
                                                            {wipeEntitlement, VSAValue(true)}});
  ASSERT_EQ(VSAReplyError(d.request(create("com.example.app"))), 1u);
  auto freezeWipe = [&] {
    size_t seen = occurrences(d.daemonOutput(), "Waiting on lock: 3");
    EXPECT_EQ(VSAReplyError(d.request(testLock(3, true))), 1u);
    auto wipe = later(request(VSACommands::kDeleteContainerContent, "com.example.app"));
    EXPECT_TRUE(
        eventually([&] { return occurrences(d.daemonOutput(), "Waiting on lock: 3") > seen; }));
    return wipe;
  };
  auto wipe = freezeWipe();
  auto lockZero = later(testLock(0, true));
  EXPECT_EQ(lockZero.wait_for(300ms), std::future_status::timeout);
  auto release = later(testLock(3, false));
  ASSERT_EQ(release.wait_for(5s), std::future_status::ready);
  EXPECT_EQ(VSAReplyError(release.get()), 1u);
  EXPECT_EQ(VSAReplyError(wipe.get()), 1u);
  EXPECT_EQ(VSAReplyError(lockZero.get()), 1u);
  ASSERT_EQ(VSAReplyError(d.request(testLock(0, false))), 1u);

  // Frozen again, with lock 1 waiting behind the wipe: a stop still ends it all.
  auto second = freezeWipe();
  auto lockOne = later(testLock(1, true));
  EXPECT_EQ(lockOne.wait_for(300ms), std::future_status::timeout);
  EXPECT_EQ(d.stop(), 0);
  EXPECT_EQ(VSAReplyError(second.get()), 1u);
}

TEST_F(Testability, KilledWhileFrozenInsideACreationTheDaemonRestartsWithoutHalfAContainer) {
  ASSERT_EQ(VSAReplyError(d.request(testLock(2, true))), 1u);
  auto frozen = later(create("com.example.frozen"));
  // Frozen between staging and the rename into place.
  ASSERT_TRUE(eventually([&] { return entries(staging()) == 1; }));
  EXPECT_EQ(frozen.wait_for(300ms), std::future_status::timeout);
  d.crash();
  EXPECT_EQ(VSAReplyError(frozen.get()), 0u);  // no reply ever came
  ASSERT_TRUE(d.start());
  EXPECT_EQ(VSAReplyError(d.request(request(VSACommands::kCreateOrLookup, "com.example.frozen"))),
            21u);
  EXPECT_TRUE(eventually([&] { return entries(staging()) == 0; }));
  // The test locks did not survive the crash: creation runs straight through.
  EXPECT_EQ(VSAReplyError(d.request(create("com.example.frozen"))), 1u);
  EXPECT_EQ(d.stop(), 0);
}

TEST_F(Testability, TheRetryTestCrashesTheDaemonAsOftenAsAskedThenFinishes) {
  auto retry = [&](uint64_t n) {
    return d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kRetryTest)},
                                          {"NumRetryCrashes", VSAValue(n)}});
  };
  EXPECT_EQ(VSAReplyError(retry(11)), 38u);
  EXPECT_EQ(VSAReplyError(retry(0)), 1u);
  EXPECT_EQ(VSAReplyError(retry(2)), 0u);  // the daemon died answering
  int status = 0;
  ASSERT_TRUE(d.waitForExit(20s, &status));
  EXPECT_TRUE(WIFSIGNALED(status));
  // The next start resumes the test and crashes once more; the one after finishes it.
  ASSERT_TRUE(d.start(false));
  ASSERT_TRUE(d.waitForExit(20s, &status));
  ASSERT_TRUE(d.start());
  EXPECT_TRUE(eventually([&] {
    return d.daemonOutput().find("Retry test finished after 2 crashes") != std::string::npos;
  }));
  EXPECT_FALSE(fs::exists(d.path("/private/var/root/Library/Vessa/RetryTest.plist")));
  EXPECT_EQ(d.stop(), 0);

  // Not an internal build: command 31 does nothing and says success, 25 is refused.
  fs::remove(d.path("/etc/vessad/device.plist"));
  ASSERT_TRUE(d.start());
  EXPECT_EQ(VSAReplyError(d.request(testLock(0, true))), 1u);
  EXPECT_EQ(VSAReplyError(d.request(create("com.example.app"), 5s)), 1u);  // not frozen
  EXPECT_EQ(VSAReplyError(retry(1)), 55u);
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonContent, AssetsAndSharedContentThroughTheSocket) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  ASSERT_EQ(VSAReplyError(d.request(create("com.example.app", VSAClass::kBundleApplication))), 1u);
  auto data = d.request(create("com.example.app"));
  ASSERT_EQ(VSAReplyError(data), 1u);
  std::string dataPath = VSAReplyString(data, "ReplyPath");

  auto assets = [&](bool relative, bool createIt) {
    return d.request(with(with(request(VSACommands::kUserManagedAssetsPath, "com.example.app"),
                               "IsRelative", VSAValue(relative)),
                          "CreateIfNecessary", VSAValue(createIt)));
  };
  auto first = assets(false, true);
  ASSERT_EQ(VSAReplyError(first), 1u);
  EXPECT_EQ(VSAReplyString(first, "ReplyPath"), dataPath + "/UserManagedAssets");
  EXPECT_FALSE(*first->get("ReplyExisted")->boolValue());
  auto second = assets(true, true);
  EXPECT_EQ(VSAReplyString(second, "ReplyPath"), "UserManagedAssets");
  EXPECT_TRUE(*second->get("ReplyExisted")->boolValue());
  std::ofstream(dataPath + "/UserManagedAssets/song") << "la";
  auto remove = [&](VSAValue path) {
    return VSAReplyError(d.request(with(
        request(VSACommands::kDeleteUserManagedAsset, "com.example.app"), "SourcePath", path)));
  };
  EXPECT_EQ(remove(VSAValue("../Documents")), 11u);
  EXPECT_EQ(remove(VSAValue(uint64_t{3})), 11u);
  EXPECT_EQ(remove(VSAValue("song")), 1u);
  EXPECT_FALSE(fs::exists(dataPath + "/UserManagedAssets/song"));

  auto bundle = d.request(
      request(VSACommands::kCreateOrLookup, "com.example.app", VSAClass::kBundleApplication));
  std::string bundlePath = VSAReplyString(bundle, "ReplyPath");
  std::ofstream(bundlePath + "/shared.db") << "rows";
  auto stage = [&](const char* src, const char* dst) {
    VSAValue body = with(with(request(VSACommands::kStageSharedContent, "com.example.app"),
                              "SourcePath", VSAValue(src)),
                         "DestPath", VSAValue(dst));
    return d.request(body);
  };
  auto staged = stage("shared.db", "Library/shared.db");
  ASSERT_EQ(VSAReplyError(staged), 1u);
  EXPECT_EQ(VSAReplyString(staged, "ReplyPath"), dataPath + "/Library/shared.db");
  std::ifstream in(dataPath + "/Library/shared.db");
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), "rows");
  EXPECT_EQ(VSAReplyError(stage("shared.db", "/etc/shadow")), 11u);
  EXPECT_EQ(d.stop(), 0);
}

// The app's data container belongs to uid 501: shared content staged to a
// nested destination lands in directories that all belong to 501 too, so
// the app can remove every one of them.
TEST(DaemonContent, SharedContentMakesTheMissingDirectoriesTheContainerOwners) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  auto bundle = d.request(create("com.example.app", VSAClass::kBundleApplication));
  auto data = d.request(create("com.example.app"));
  ASSERT_EQ(VSAReplyError(data), 1u);
  std::string bundlePath = VSAReplyString(bundle, "ReplyPath");
  std::string dataPath = VSAReplyString(data, "ReplyPath");
  auto owner = [](const std::string& path) {
    struct stat st {};
    return ::lstat(path.c_str(), &st) == 0 ? st.st_uid : ~0u;
  };
  ASSERT_EQ(owner(dataPath), 501u);
  fs::create_directories(bundlePath + "/Shared/fonts");
  std::ofstream(bundlePath + "/Shared/fonts/serif") << "glyphs";
  VSAValue body = with(with(request(VSACommands::kStageSharedContent, "com.example.app"),
                            "SourcePath", VSAValue("Shared")),
                       "DestPath", VSAValue("Documents/a/b/c/Shared"));
  auto staged = d.request(body);
  ASSERT_EQ(VSAReplyError(staged), 1u);
  EXPECT_EQ(VSAReplyString(staged, "ReplyPath"), dataPath + "/Documents/a/b/c/Shared");
  for (const char* made :
       {"/Documents/a", "/Documents/a/b", "/Documents/a/b/c", "/Documents/a/b/c/Shared",
        "/Documents/a/b/c/Shared/fonts", "/Documents/a/b/c/Shared/fonts/serif"})
    EXPECT_EQ(owner(dataPath + made), 501u) << made;
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace

namespace {

// A staging leftover of 10,000 files keeps the start's cleanup busy well
// after the daemon serves: a request sent at once is answered before the
// cleanup-complete notification.
TEST(DaemonBoot, RequestsAreServedWhileTheCleanupsRun) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  std::string leftover =
      d.path("/private/var/mobile/Containers/Staging/" + VSAUUID::random().string() + "/Documents");
  fs::create_directories(leftover);
  for (int i = 0; i < 100; ++i) {
    std::string dir = leftover + "/" + std::to_string(i);
    fs::create_directory(dir);
    for (int j = 0; j < 100; ++j) std::ofstream(dir + "/" + std::to_string(j));
  }
  ASSERT_TRUE(d.start());
  auto reply = d.request(create("com.example.app"));
  auto posted = d.notifications();
  EXPECT_EQ(VSAReplyError(reply), 1u);
  EXPECT_EQ(std::count(posted.begin(), posted.end(), "com.tamsk.vessad.cleanup-complete"), 0);
  ASSERT_TRUE(d.waitForNotifications(2, 60s));
  EXPECT_FALSE(fs::exists(leftover));
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
