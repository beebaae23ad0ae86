// End to end: requests and on-disk state written by an attacker, against
// the real daemon. Names that would leave their directory are refused at
// the door; a user's directory swapped for a link leads nowhere; an app's
// metadata file speaks for no other container; a system container backup
// is restored only as root left it; the daemon's private files stay
// private.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "base/VSAJSON.h"
#include "base/VSAPlist.h"
#include "base/VSAUUID.h"
#include "e2e/VSATestDaemon.h"

namespace fs = std::filesystem;

namespace {

const char* kAllowed = "com.tamsk.private.Vessa.allowed";

VSAValue request(VSACommandNumber command, const std::string& id,
                 VSAContainerClass containerClass = VSAClass::kDataApplication) {
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
    EXPECT_EQ(VSAReplyError(d.request(request(VSACommands::kCreateOrLookup, id))), 11u);
    EXPECT_EQ(VSAReplyError(d.request(request(VSACommands::kDeleteContainer, id))), 11u);
    VSAValue protect = request(VSACommands::kSetDataProtection, id);
    protect.set("DataProtectionClass", VSAValue(int64_t{3}));
    EXPECT_EQ(VSAReplyError(d.request(protect)), 11u);
    EXPECT_EQ(VSAReplyError(d.request(request(VSACommands::kReadCodeSigningInfo, id))), 11u);
    VSAValue record = request(VSACommands::kRecordCodeSigningInfo, id);
    record.set("CodeSigningInfo", VSAValue::dictionary());
    EXPECT_EQ(VSAReplyError(d.request(record)), 11u);
  }
  VSAValue persona = request(VSACommands::kCreateOrLookup, "com.example.app");
  persona.set("PersonaUniqueString", VSAValue("../../x"));
  EXPECT_EQ(VSAReplyError(d.request(persona)), 11u);
  // The longest name allowed still works.
  EXPECT_EQ(VSAReplyError(d.request(request(VSACommands::kCreateOrLookup, std::string(255, 'b')))),
            1u);
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
  ASSERT_EQ(VSAReplyError(d.request(request(VSACommands::kCreateOrLookup, "com.example.first"))),
            1u);
  // The user owns Containers/: it replaces Data with a link to a root-owned
  // place and waits for the next creation.
  std::string data = d.path("/private/var/mobile/Containers/Data");
  ASSERT_TRUE(fs::is_directory(data));
  std::string target = d.path("/private/var/root-owned");
  fs::create_directories(target + "/Application");
  fs::rename(data, data + ".real");
  fs::create_directory_symlink(target, data);
  auto reply = d.request(request(VSACommands::kCreateOrLookup, "com.example.second"));
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
  EXPECT_NE(VSAReplyError(d.request(request(VSACommands::kCreateOrLookup, "com.example.third"))),
            1u);
  EXPECT_TRUE(fs::is_empty(target + "/Application"));
  EXPECT_EQ(std::distance(fs::directory_iterator(target), {}), 1) << "nothing but what was there";
  EXPECT_EQ(d.stop(), 0);
}

TEST(HostileRequests, AnAppsMetadataFileSpeaksForNoOtherContainer) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                                      {"com.tamsk.private.Vessa.otherIdLookup", VSAValue(true)}});
  // The app: a client that runs as the mobile user.
  fs::copy_file(VESSACTL_PATH, d.path("/usr/bin/app"));
  ASSERT_TRUE(VSA_writeToURL(
      VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/app")},
                           {"SigningIdentifier", VSAValue("com.example.app")},
                           {"Entitlements", VSAValue::Dictionary{{kAllowed, VSAValue(true)}}},
                           {"User", VSAValue(uint64_t{501})}},
      d.path("/etc/vessad/clients.d/app.plist"), 0, nullptr));
  fs::permissions(d.root(), fs::perms(0755));  // the app reaches its client and the socket
  ASSERT_TRUE(d.start());
  VSAValue system = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kSystemContainerPath)},
                                         {"Identifier", VSAValue("com.example.sys")}};
  auto real = d.request(system);
  ASSERT_EQ(VSAReplyError(real), 1u);
  std::string systemPath = VSAReplyString(real, "ReplyPath");
  auto app = [&](std::vector<std::string> args) {
    std::vector<std::string> full = {d.path("/usr/bin/app"), "--root", d.root(), "--json"};
    full.insert(full.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& a : full) argv.push_back(a.data());
    argv.push_back(nullptr);
    return VSARunAsMobileUser([&] { return execv(argv[0], argv.data()), 127; });
  };
  auto parsed = [](const VSATestDaemon::Run& run) {
    std::string why;
    return VSAJSON::parse(run.output, &why);
  };
  auto made = app(
      {"Command=0", "Identifier=com.example.app", "ContainerClass=2", "CreateIfNecessary=true"});
  ASSERT_EQ(made.status, 0) << made.output;
  std::string own = VSAReplyString(parsed(made), "ReplyPath");
  ASSERT_FALSE(own.empty()) << made.output;
  ASSERT_NE(own, systemPath);

  // The app rewrites the metadata file of its own container to claim the
  // system container, then has the daemon read it again.
  auto forged = VSAPlist::serialize(
      VSAValue::Dictionary{{"VSAMetadataIdentifier", VSAValue("com.example.sys")},
                           {"VSAMetadataUUID", VSAValue(VSAUUID::random().string())},
                           {"VSAMetadataContentClass", VSAValue(VSAClass::kSystemData)},
                           {"VSAMetadataVersion", VSAValue("2")}},
      VSAPlist::Format::Binary, nullptr);
  ASSERT_TRUE(forged);
  std::string file = own + "/.com.tamsk.vessa_keeper.metadata.plist";
  ASSERT_EQ(VSARunAsMobileUser([&] {
              unlink(file.c_str());
              int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
              bool whole = fd >= 0 && write(fd, forged->data(), forged->size()) ==
                                          static_cast<ssize_t>(forged->size());
              return whole && close(fd) == 0 ? 0 : 1;
            }).status,
            0);
  auto set =
      app({"Command=5", "Identifier=com.example.app", "ContainerClass=2", "Key=k", "Value=v"});
  EXPECT_EQ(VSAReplyError(parsed(set)), 12u) << set.output;
  auto read = app({"Command=6", "Identifier=com.example.app", "ContainerClass=2", "Key=k"});
  EXPECT_EQ(VSAReplyError(parsed(read)), 12u) << read.output;

  // The system container is where it was, for every way of asking.
  auto again = d.request(system);
  ASSERT_EQ(VSAReplyError(again), 1u);
  EXPECT_EQ(VSAReplyString(again, "ReplyPath"), systemPath);
  auto looked =
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kCreateOrLookup)},
                                     {"Identifier", VSAValue("com.example.sys")},
                                     {"ContainerClass", VSAValue(VSAClass::kSystemData)}});
  ASSERT_EQ(VSAReplyError(looked), 1u);
  EXPECT_EQ(VSAReplyString(looked, "ReplyPath"), systemPath);
  EXPECT_EQ(d.stop(), 0);
}

// Every path below `dir` whose file name is `name`.
std::vector<std::string> named(const std::string& dir, const std::string& name) {
  std::vector<std::string> out;
  for (const auto& p : tree(dir))
    if (fs::path(p).filename() == name) out.push_back(p);
  return out;
}

TEST(HostileRequests, ASystemContainerBackupIsRestoredOnlyAsRootLeftIt) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                                      {"com.tamsk.private.Vessa.otherIdLookup", VSAValue(true)}});
  fs::permissions(d.root(), fs::perms(0755));
  // The backups lie in the mobile user's home. Root left one of system
  // containers; the user made one of system group containers, a tree of its
  // own to swap in, and a big stale in-progress directory whose removal
  // keeps the daemon busy between its look at the backup and its move.
  std::string base = d.path("/private/var/mobile/Library/Backup/SystemContainers");
  fs::create_directories(base + "/Data/com.example.sys");
  std::ofstream(base + "/Data/com.example.sys/genuine.txt") << "root's";
  for (const char* dir : {"/private/var/mobile/Library", "/private/var/mobile/Library/Backup",
                          "/private/var/mobile/Library/Backup/SystemContainers"})
    ASSERT_EQ(chown(d.path(dir).c_str(), 501, 501), 0);
  std::string armed = base + "/armed";
  ASSERT_EQ(VSARunAsMobileUser([&] {
              for (const std::string& dir :
                   {base + "/Shared", base + "/Shared/systemgroup.com.example.planted",
                    base + "/Evil", base + "/Evil/com.example.sys", base + "/Data.inprogress"})
                if (mkdir(dir.c_str(), 0755) != 0) return 1;
              for (const std::string& file :
                   {base + "/Shared/systemgroup.com.example.planted/planted.txt",
                    base + "/Evil/com.example.sys/planted.txt"})
                if (!std::ofstream(file).put('x')) return 2;
              for (int i = 0; i < 30000; ++i)
                if (!std::ofstream(base + "/Data.inprogress/" + std::to_string(i))) return 3;
              return 0;
            }).status,
            0);
  // The swap, the moment the daemon starts removing the stale directory.
  auto swapper = std::async(std::launch::async, [&] {
    return VSARunAsMobileUser([&] {
             int watch = inotify_init1(IN_CLOEXEC);
             if (watch < 0 ||
                 inotify_add_watch(watch, (base + "/Data.inprogress").c_str(), IN_DELETE) < 0)
               return 1;
             if (!std::ofstream(armed)) return 2;
             pollfd p{watch, POLLIN, 0};
             if (poll(&p, 1, 30000) != 1) return 3;
             rename((base + "/Data").c_str(), (base + "/Data.genuine").c_str());
             rename((base + "/Evil").c_str(), (base + "/Data").c_str());
             return 0;
           })
        .status;
  });
  for (int i = 0; i < 1000 && !fs::exists(armed); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  ASSERT_TRUE(fs::exists(armed));
  ASSERT_TRUE(d.start(true, {"--after-boot"}));
  swapper.wait();

  auto reply =
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kSystemContainerPath)},
                                     {"Identifier", VSAValue("com.example.sys")}});
  ASSERT_EQ(VSAReplyError(reply), 1u);
  std::string live = VSAReplyString(reply, "ReplyPath");
  EXPECT_TRUE(fs::exists(live + "/genuine.txt"));
  EXPECT_TRUE(named(d.path("/private/var/containers"), "planted.txt").empty());
  EXPECT_TRUE(named(d.path("/private/var/root"), "planted.txt").empty());
  EXPECT_NE(d.daemonOutput().find("Not restoring"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

TEST(HostileRequests, TheCodeSigningDatabaseIsReadableByRootAlone) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  VSAValue record = request(VSACommands::kRecordCodeSigningInfo, "com.example.app");
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
