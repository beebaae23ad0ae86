#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <climits>
#include <filesystem>
#include <fstream>
#include <thread>

#include "VSATestTempDir.h"
#include "base/VSAPlist.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSADeviceProperties.h"
#include "platform/VSALockStateService.h"
#include "platform/VSANamedSemaphore.h"
#include "platform/VSANotificationCenter.h"
#include "platform/VSAPeerExecutable.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSAUniqueFd.h"

namespace {

using namespace std::chrono_literals;

class VSAPlatformRoot : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    std::filesystem::create_directories(root_ + "/etc/vessad/clients.d");
    std::filesystem::create_directories(root_ + "/run/vessad");
    std::filesystem::create_directories(root_ + "/usr/bin");
  }

  void writePlist(const std::string& path, const VSAValue& v) {
    VSAErrorRef error;
    ASSERT_TRUE(VSA_writeToURL(v, path, 0, &error));
  }
  std::string selfExe() {
    char buf[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
    return std::string(buf, n);
  }
  VSATestTempDir temp_{"vessa-root"};
  std::string root_;
};

TEST_F(VSAPlatformRoot, SystemRootResolvesDevicePaths) {
  VSASystemRoot root(root_ + "/");
  EXPECT_EQ(root.path(), root_);
  EXPECT_EQ(root.resolve("/private/var/containers"), root_ + "/private/var/containers");
  EXPECT_EQ(root.socketPath(), root_ + "/run/vessad/com.tamsk.vessad");
  VSASystemRoot host("/");
  EXPECT_EQ(host.resolve("/tmp"), "/tmp");
  EXPECT_NE(root.hashSuffix(), VSASystemRoot(root_ + "/etc").hashSuffix());
}

TEST_F(VSAPlatformRoot, ClientRegistryMatchesTheRealExecutable) {
  // The registry names the executable by its path on the device; a symlink in
  // the root pointing at this test binary resolves to the same real file.
  std::filesystem::create_symlink(selfExe(), root_ + "/usr/bin/tester");
  writePlist(root_ + "/etc/vessad/clients.d/tester.plist",
             VSAValue::Dictionary{
                 {"Executable", VSAValue("/usr/bin/tester")},
                 {"SigningIdentifier", VSAValue("com.example.tester")},
                 {"Entitlements",
                  VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}}},
                 {"Sandboxed", VSAValue(true)},
             });
  VSAClientRegistry registry{VSASystemRoot(root_)};
  VSAAuditToken me{getpid(), getuid(), getgid(), VSAAuditToken::processStartTime(getpid())};
  auto entry = registry.entryForAuditToken(me);
  ASSERT_TRUE(entry);
  EXPECT_EQ(entry->signingIdentifier, "com.example.tester");
  EXPECT_TRUE(entry->sandboxed);
  EXPECT_FALSE(entry->kernelBridge);
  EXPECT_TRUE(entry->entitlements.get("com.tamsk.private.Vessa.allowed")->boolValue().value());
  // A token whose start time no longer matches names a different process.
  VSAAuditToken stale = me;
  stale.startTime += 1;
  EXPECT_FALSE(registry.entryForAuditToken(stale));
}

TEST_F(VSAPlatformRoot, UntrustedOrMalformedRegistryEntriesGiveNoIdentity) {
  std::filesystem::create_symlink(selfExe(), root_ + "/usr/bin/tester");
  std::string dir = root_ + "/etc/vessad/clients.d/";
  VSAValue good = VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/tester")},
                                       {"SigningIdentifier", VSAValue("com.example.tester")}};
  // World-writable: anyone could have granted themselves entitlements.
  writePlist(dir + "a.plist", good);
  chmod((dir + "a.plist").c_str(), 0666);
  // Wrong types.
  VSAValue badEnt = good;
  badEnt.set("Entitlements", VSAValue("YES"));
  writePlist(dir + "b.plist", badEnt);
  VSAValue relative = good;
  relative.set("Executable", VSAValue("usr/bin/tester"));
  writePlist(dir + "c.plist", relative);
  std::ofstream(dir + "d.plist") << "not a plist";
  VSAClientRegistry registry{VSASystemRoot(root_)};
  VSAAuditToken me{getpid(), getuid(), getgid(), VSAAuditToken::processStartTime(getpid())};
  EXPECT_FALSE(registry.entryForAuditToken(me));
  // Fixing one entry is picked up without a restart.
  chmod((dir + "a.plist").c_str(), 0644);
  std::filesystem::remove(dir + "b.plist");  // touches the directory
  EXPECT_TRUE(registry.entryForAuditToken(me));
}

TEST_F(VSAPlatformRoot, LockStateFileAndNotification) {
  VSALockStateService service{VSASystemRoot(root_)};
  EXPECT_EQ(service.currentLockState(), 0) << "no file means unlocked";
  // Notifications queued by the writes below may run after this body returns.
  auto notified = std::make_shared<std::atomic<int>>(0);
  auto queue = VSAWorkQueue::create("test.lockstate.notify");
  ASSERT_EQ(service.registerForLockStatus(queue, [notified] { ++*notified; }), 0);
  ASSERT_TRUE(service.setLockState(1));
  for (int i = 0; i < 1000 && *notified == 0; ++i) std::this_thread::sleep_for(5ms);
  EXPECT_GE(notified->load(), 1);
  EXPECT_EQ(service.currentLockState(), 1);
  std::ofstream(service.stateFilePath()) << "garbage";
  EXPECT_EQ(service.currentLockState(), -1);
  std::ofstream(service.stateFilePath()) << "2";
  EXPECT_EQ(service.currentLockState(), 2);
}

TEST_F(VSAPlatformRoot, NamedSemaphoreIsPerRoot) {
  VSASystemRoot root(root_);
  std::string name = VSANamedSemaphore::nameForRoot("vessad.fb_check", root);
  EXPECT_NE(name, "vessad.fb_check");
  EXPECT_EQ(VSANamedSemaphore::nameForRoot("vessad.fb_check", VSASystemRoot("/")),
            "vessad.fb_check");
  EXPECT_FALSE(VSANamedSemaphore::exists(name));
  ASSERT_TRUE(VSANamedSemaphore::create(name));
  EXPECT_TRUE(VSANamedSemaphore::exists(name));
  VSANamedSemaphore::remove(name);
  EXPECT_FALSE(VSANamedSemaphore::exists(name));
}

TEST_F(VSAPlatformRoot, NotificationsAndDeviceProperties) {
  VSASystemRoot root(root_);
  VSANotificationCenter center(root);
  EXPECT_EQ(center.post("a.b"), 0u);
  EXPECT_EQ(center.post(CONTAINER_NOTIFY_CLEANUP_COMPLETE), 0u);
  EXPECT_EQ(center.postedNames(),
            (std::vector<std::string>{"a.b", CONTAINER_NOTIFY_CLEANUP_COMPLETE}));
  EXPECT_FALSE(VSADeviceProperties(root).hasInternalContent());
  writePlist(
      root_ + "/etc/vessad/device.plist",
      VSAValue::Dictionary{{"HasInternalContent", VSAValue(true)}, {"MultiUser", VSAValue("x")}});
  VSADeviceProperties props(root);
  EXPECT_TRUE(props.hasInternalContent());
  EXPECT_FALSE(props.isMultiUser()) << "a malformed flag takes its default";
  EXPECT_FALSE(props.usesEphemeralStorage());
}

}  // namespace

// The /proc directory opened at accept stands for the peer process: it says
// "still runs the pinned file" while the process lives, and nothing after it
// has been reaped (when its pid may already belong to another process).
TEST(PeerExecutable, ProcessDirectorySeesThePeerOnlyWhileItLives) {
  int ready[2];
  ASSERT_EQ(::pipe(ready), 0);
  pid_t child = ::fork();
  if (child == 0) {
    char c;
    ::close(ready[1]);
    ::read(ready[0], &c, 1);  // lives until the parent closes its end
    ::_exit(0);
  }
  ::close(ready[0]);
  VSAAuditToken token;
  token.pid = child;
  token.startTime = VSAAuditToken::processStartTime(child);
  auto pinned = VSAPeerExecutable::ofProcess(token);
  ASSERT_TRUE(pinned);
  VSAUniqueFd directory(VSAPeerExecutable::openProcessDirectory(token));
  ASSERT_GE(directory.get(), 0);
  EXPECT_TRUE(pinned->isRunByProcessAt(directory.get()));
  VSAPeerExecutable other = *pinned;
  other.inode += 1;
  EXPECT_FALSE(other.isRunByProcessAt(directory.get())) << "another file is not the pinned one";
  ::close(ready[1]);
  int status = 0;
  ::waitpid(child, &status, 0);
  EXPECT_FALSE(pinned->isRunByProcessAt(directory.get())) << "a reaped process runs nothing";
  // A token whose start time is not its pid's names another process: no directory.
  VSAAuditToken stale;
  stale.pid = ::getpid();
  stale.startTime = VSAAuditToken::processStartTime(stale.pid) + 1;
  EXPECT_EQ(VSAPeerExecutable::openProcessDirectory(stale), -1);
}
