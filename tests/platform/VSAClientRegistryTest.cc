// Registry entries are refused when their executable could be rewritten by a
// non-root user, and an entry naming a "User" only identifies peers of that uid.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "base/VSAPlist.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAIPCConnection.h"
#include "platform/VSAProcessRecords.h"

namespace {

namespace fs = std::filesystem;

class VSAClientRegistryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    fs::create_directories(root_ + "/etc/vessad/clients.d");
    fs::create_directories(root_ + "/usr/bin");
    std::ofstream(root_ + "/etc/passwd") << "root:x:0:0::/private/var/root:/bin/sh\n"
                                            "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
  }
  // Installs a copy of /bin/true at the device path `exe` and registers it.
  void install(const std::string& name, const std::string& exe,
               std::optional<VSAValue> user = std::nullopt) {
    fs::create_directories(fs::path(root_ + exe).parent_path());
    fs::copy_file("/bin/true", root_ + exe, fs::copy_options::overwrite_existing);
    chmod((root_ + exe).c_str(), 0755);
    VSAValue entry = VSAValue::Dictionary{{"Executable", VSAValue(exe)},
                                          {"SigningIdentifier", VSAValue("com.example." + name)}};
    if (user) entry.set("User", *user);
    VSAErrorRef error;
    ASSERT_TRUE(
        VSA_writeToURL(entry, root_ + "/etc/vessad/clients.d/" + name + ".plist", 0, &error));
  }
  std::string host(const std::string& exe) { return fs::canonical(root_ + exe).string(); }
  static VSAAuditToken tokenWithUID(uid_t uid) {
    return VSAAuditToken{getpid(), uid, 0, VSAAuditToken::processStartTime(getpid())};
  }

  VSATestTempDir temp_{"vessa-registry"};
  std::string root_;
};

TEST_F(VSAClientRegistryTest, ExecutablesWritableByOthersThanRootAreRefused) {
  install("good", "/usr/bin/good");
  install("groupwritable", "/usr/bin/groupwritable");
  chmod((root_ + "/usr/bin/groupwritable").c_str(), 0775);
  install("worldwritable", "/usr/bin/worldwritable");
  chmod((root_ + "/usr/bin/worldwritable").c_str(), 0757);
  install("notroot", "/usr/bin/notroot");
  ASSERT_EQ(chown((root_ + "/usr/bin/notroot").c_str(), 1234, 0), 0);
  install("opendir", "/opt/open/tool");
  chmod((root_ + "/opt/open").c_str(), 01777);
  install("userdir", "/opt/user/tool");
  ASSERT_EQ(chown((root_ + "/opt/user").c_str(), 1234, 1234), 0);

  VSAClientRegistry registry{VSASystemRoot(root_)};
  EXPECT_TRUE(registry.entryForExecutable(host("/usr/bin/good")));
  for (const char* exe : {"/usr/bin/groupwritable", "/usr/bin/worldwritable", "/usr/bin/notroot",
                          "/opt/open/tool", "/opt/user/tool"})
    EXPECT_FALSE(registry.entryForExecutable(host(exe))) << exe;

  // An executable opened up after its entry was loaded no longer identifies anyone.
  auto me = tokenWithUID(0);
  EXPECT_TRUE(registry.entryForPeer(me, host("/usr/bin/good")));
  chmod((root_ + "/usr/bin/good").c_str(), 0777);
  EXPECT_FALSE(registry.entryForPeer(me, host("/usr/bin/good")));
  chmod((root_ + "/usr/bin/good").c_str(), 0755);
  chmod((root_ + "/usr/bin").c_str(), 0775);
  EXPECT_FALSE(registry.entryForPeer(me, host("/usr/bin/good")));
}

TEST_F(VSAClientRegistryTest, AnEntryNamingAUserIdentifiesOnlyThatUID) {
  install("byuid", "/usr/bin/byuid", VSAValue(501));
  install("byname", "/usr/bin/byname", VSAValue("mobile"));
  install("rootname", "/usr/bin/rootname", VSAValue("root"));
  install("anyone", "/usr/bin/anyone");
  install("unknown", "/usr/bin/unknown", VSAValue("nosuchuser"));
  install("malformed", "/usr/bin/malformed", VSAValue(true));
  VSAClientRegistry registry{VSASystemRoot(root_)};
  auto root = tokenWithUID(0), mobile = tokenWithUID(501), other = tokenWithUID(777);

  EXPECT_FALSE(registry.entryForPeer(root, host("/usr/bin/byuid")));
  EXPECT_FALSE(registry.entryForPeer(other, host("/usr/bin/byuid")));
  auto entry = registry.entryForPeer(mobile, host("/usr/bin/byuid"));
  ASSERT_TRUE(entry);
  EXPECT_EQ(entry->user, uid_t(501));
  EXPECT_TRUE(registry.entryForPeer(mobile, host("/usr/bin/byname")));
  EXPECT_FALSE(registry.entryForPeer(root, host("/usr/bin/byname")));
  EXPECT_TRUE(registry.entryForPeer(root, host("/usr/bin/rootname")));
  EXPECT_FALSE(registry.entryForPeer(mobile, host("/usr/bin/rootname")));
  // Naming no user means root: a process of another uid can exec the program,
  // but never becomes that client.
  EXPECT_TRUE(registry.entryForPeer(root, host("/usr/bin/anyone")));
  EXPECT_FALSE(registry.entryForPeer(mobile, host("/usr/bin/anyone")));
  EXPECT_FALSE(registry.entryForPeer(other, host("/usr/bin/anyone")));
  // A user that cannot be resolved, or a value of the wrong type, refuses the entry.
  EXPECT_FALSE(registry.entryForPeer(root, host("/usr/bin/unknown")));
  EXPECT_FALSE(registry.entryForPeer(root, host("/usr/bin/malformed")));
}

TEST_F(VSAClientRegistryTest, ALaunchRecordIdentifiesOnlyAPeerThatIsNotRoot) {
  install("anyone", "/usr/bin/anyone");
  VSAClientRegistry registry{VSASystemRoot(root_)};
  auto root = tokenWithUID(0), mobile = tokenWithUID(501);
  ASSERT_EQ(VSAProcessRecords(VSASystemRoot(root_))
                .write(VSAProcessRecordKind::SigningIdentifier, root.pid, root.startTime,
                       "com.example.app"),
            0);
  auto app = registry.entryForPeer(mobile, host("/usr/bin/anyone"));
  ASSERT_TRUE(app);
  EXPECT_TRUE(app->launched);
  EXPECT_EQ(app->signingIdentifier, "com.example.app");
  auto rooted = registry.entryForPeer(root, host("/usr/bin/anyone"));
  ASSERT_TRUE(rooted) << "root keeps the identity of the program it runs";
  EXPECT_FALSE(rooted->launched);
  EXPECT_EQ(rooted->signingIdentifier, "com.example.anyone");
}

TEST_F(VSAClientRegistryTest, AConnectionPinsItsPeersEntryOnlyForTheRightUser) {
  // This test process is the peer; it runs as root.
  ASSERT_EQ(geteuid(), 0u);
  char buf[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
  ASSERT_GT(n, 0);
  fs::create_symlink(std::string(buf, n), root_ + "/usr/bin/self");
  auto registerSelf = [&](const VSAValue& user) {
    VSAErrorRef error;
    ASSERT_TRUE(VSA_writeToURL(VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/self")},
                                                    {"SigningIdentifier", VSAValue("com.self")},
                                                    {"User", user}},
                               root_ + "/etc/vessad/clients.d/self.plist", 0, &error));
  };
  auto connect = [&](VSAClientRegistry& registry) {
    int fds[2];
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    ::close(fds[1]);
    return std::make_shared<VSAIPCConnection>(fds[0], 1, *VSAAuditToken::fromSocket(fds[0]),
                                              &registry);
  };
  registerSelf(VSAValue("mobile"));
  {
    VSAClientRegistry registry{VSASystemRoot(root_)};
    auto connection = connect(registry);
    EXPECT_FALSE(connection->registryEntry()) << "uid 0 is not the entry's user";
    EXPECT_TRUE(connection->peerIsUnchanged());
  }
  registerSelf(VSAValue(0));
  {
    VSAClientRegistry registry{VSASystemRoot(root_)};
    auto connection = connect(registry);
    ASSERT_TRUE(connection->registryEntry());
    EXPECT_EQ(connection->registryEntry()->signingIdentifier, "com.self");
    ASSERT_TRUE(connection->executable());
    EXPECT_EQ(connection->executable()->path, std::string(buf, n));
  }
}

}  // namespace
