// End to end: requests and on-disk state written by an attacker, against
// the real daemon. Names that would leave their directory are refused at
// the door; a user's directory swapped for a link leads nowhere; the
// daemon's private files stay private.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "e2e/VSATestDaemon.h"

namespace fs = std::filesystem;

namespace {

const char* kAllowed = "com.tamsk.private.Vessa.allowed";

VSAValue request(uint64_t command, const std::string& id, uint64_t containerClass = 2) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)},
                              {"Identifier", VSAValue(id)},
                              {"ContainerClass", VSAValue(containerClass)},
                              {"CreateIfNecessary", VSAValue(true)}};
}

// Every file below `dir` (links and directories included), as paths.
std::set<std::string> tree(const std::string& dir) {
  std::set<std::string> out;
  std::error_code ec;
  for (auto it = fs::recursive_directory_iterator(dir, ec); it != fs::end(it); it.increment(ec))
    out.insert(it->path().string());
  return out;
}

TEST(HostileRequests, NamesThatCouldLeaveTheirDirectoryAreRefusedWithEleven) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  fs::create_directories(d.path("/private/var/victim"));
  std::ofstream(d.path("/private/var/victim/file")) << "keep";
  auto before = tree(d.root());
  const std::string nul("com.example\0evil", 16);
  const std::vector<std::string> hostile = {"..",   ".", "../../../private/var/victim", "a/b",
                                            "/abs", nul, std::string(256, 'a')};
  for (const auto& id : hostile) {
    SCOPED_TRACE(id.size() > 40 ? "long identifier" : id);
    EXPECT_EQ(VSAReplyError(d.request(request(0, id))), 11u);
    EXPECT_EQ(VSAReplyError(d.request(request(10, id))), 11u);
    VSAValue protect = request(21, id);
    protect.set("DataProtectionClass", VSAValue(int64_t{3}));
    EXPECT_EQ(VSAReplyError(d.request(protect)), 11u);
    EXPECT_EQ(VSAReplyError(d.request(request(19, id))), 11u);
    VSAValue record = request(18, id);
    record.set("CodeSigningInfo", VSAValue::dictionary());
    EXPECT_EQ(VSAReplyError(d.request(record)), 11u);
  }
  VSAValue persona = request(0, "com.example.app");
  persona.set("PersonaUniqueString", VSAValue("../../x"));
  EXPECT_EQ(VSAReplyError(d.request(persona)), 11u);
  // The longest name allowed still works.
  EXPECT_EQ(VSAReplyError(d.request(request(0, std::string(255, 'b')))), 1u);
  EXPECT_TRUE(fs::exists(d.path("/private/var/victim/file")));
  // Nothing was made for any refused request (only the allowed one's container).
  std::set<std::string> made;
  for (const auto& p : tree(d.root()))
    if (!before.count(p) && p.find(std::string(255, 'b')) == std::string::npos &&
        p.find("/Logs/") == std::string::npos && p.find("/run/") == std::string::npos)
      made.insert(p);
  for (const auto& p : made) EXPECT_EQ(p.find("victim"), std::string::npos) << p;
  // One refusal line per request at most, and the log is not flooded.
  EXPECT_EQ(d.stop(), 0);
}

TEST(HostileRequests, AUsersDirectorySwappedForALinkLeadsNowhere) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  ASSERT_EQ(VSAReplyError(d.request(request(0, "com.example.first"))), 1u);
  // The user owns Containers/: it replaces Data with a link to a root-owned
  // place and waits for the next creation.
  std::string data = d.path("/private/var/mobile/Containers/Data");
  ASSERT_TRUE(fs::is_directory(data));
  std::string target = d.path("/private/var/root-owned");
  fs::create_directories(target + "/Application");
  fs::rename(data, data + ".real");
  fs::create_directory_symlink(target, data);
  auto reply = d.request(request(0, "com.example.second"));
  EXPECT_NE(VSAReplyError(reply), 1u);
  EXPECT_TRUE(fs::is_empty(target + "/Application")) << "a container was assembled outside";
  struct stat st;
  ASSERT_EQ(lstat(target.c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 0u) << "root gave a directory it did not make to the user";
  ASSERT_EQ(lstat((target + "/Application").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 0u);
  // Staging swapped too.
  std::string staging = d.path("/private/var/mobile/Containers/Staging");
  fs::remove(data);
  fs::rename(data + ".real", data);
  if (fs::exists(staging)) fs::rename(staging, staging + ".real");
  fs::create_directory_symlink(target, staging);
  EXPECT_NE(VSAReplyError(d.request(request(0, "com.example.third"))), 1u);
  EXPECT_TRUE(fs::is_empty(target + "/Application"));
  EXPECT_EQ(std::distance(fs::directory_iterator(target), {}), 1) << "nothing but what was there";
  EXPECT_EQ(d.stop(), 0);
}

TEST(HostileRequests, TheCodeSigningDatabaseIsReadableByRootAlone) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  VSAValue record = request(18, "com.example.app");
  record.set("CodeSigningInfo", VSAValue::dictionary());
  ASSERT_EQ(VSAReplyError(d.request(record)), 1u);
  std::string dir = d.path("/private/var/root/Library/Vessa");
  size_t checked = 0;
  for (const auto& e : fs::directory_iterator(dir)) {
    if (e.path().filename().string().rfind("containers.sqlite3", 0) != 0) continue;
    struct stat st;
    ASSERT_EQ(lstat(e.path().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 077, 0u) << e.path();
    ++checked;
  }
  EXPECT_GE(checked, 2u) << "the database and its write-ahead log";
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
