// The root checker: silent on a root the daemon keeps, loud on each kind of
// damage a crash, a bug or a hostile app could leave, and harmless itself
// (it changes nothing, and refuses a root that a daemon is serving).
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <set>

#include "VSAContainerTestRoot.h"
#include "daemon/VSARootChecker.h"
#include "dataprotection/VSADataProtectionUpdateFile.h"

namespace fs = std::filesystem;

namespace {

class RootChecker : public VSAContainerTestRoot {
 protected:
  VSAMetadataRef made(const std::string& id, VSAContainerClass c = VSAClass::kDataApplication) {
    VSAResultCode code;
    auto m = create(*installer(), id, &code, false, c);
    EXPECT_TRUE(m) << code;
    return m;
  }
  // Every path below the root with its size and modification time.
  std::map<std::string, std::string> tree() {
    std::map<std::string, std::string> out;
    for (const auto& e : fs::recursive_directory_iterator(root_)) {
      struct stat st;
      if (::lstat(e.path().c_str(), &st) != 0) continue;
      out[e.path().string()] =
          std::to_string(st.st_size) + "@" + std::to_string(st.st_mtim.tv_sec) + "." +
          std::to_string(st.st_mtim.tv_nsec) + " " + std::to_string(st.st_mode);
    }
    return out;
  }
  // Findings by kind -> paths.
  static std::map<std::string, std::set<std::string>> byKind(const VSARootChecker& checker) {
    std::map<std::string, std::set<std::string>> out;
    for (const auto& f : checker.findings()) out[f.kind].insert(f.path);
    return out;
  }
};

TEST_F(RootChecker, AKeptRootIsCleanAndCheckingItChangesNothing) {
  made("com.example.app");
  made("com.example.sys", VSAClass::kSystemData);
  made("com.example.bundle", VSAClass::kBundleApplication);
  made("group.example.shared", VSAClass::kAppGroup);
  context_.reset();  // a root at rest, as after a clean stop
  auto before = tree();
  VSARootChecker checker(root_);
  EXPECT_EQ(checker.check(), VSARootChecker::kClean) << checker.text();
  EXPECT_EQ(checker.counts().at("containers"), 4u);
  // No identifier names the group: worth a note, not a finding.
  ASSERT_EQ(checker.notes().size(), 1u);
  EXPECT_EQ(checker.notes()[0].kind, "unreferenced-group");
  EXPECT_EQ(tree(), before);
  EXPECT_NE(checker.json().find("\"status\": \"clean\""), std::string::npos) << checker.json();
}

TEST_F(RootChecker, EachKindOfDamageIsFoundWithItsPath) {
  auto broken = made("com.example.broken");
  auto copied = made("com.example.copied");
  auto opened = made("com.example.opened");
  auto given = made("com.example.given");
  auto sys = made("com.example.sys", VSAClass::kSystemData);
  std::string classDir = classDirectory();
  std::string orphan = classDir + "/" + VSAUUID::random().string();
  fs::create_directories(orphan + "/Documents");
  put(classDir + "/not-a-container", "x");
  put(broken->url() + "/" + kVSAMetadataFileName, "garbage");
  std::string twin = classDir + "/" + VSAUUID::random().string();
  fs::copy(copied->url(), twin, fs::copy_options::recursive);
  ::chmod(opened->url().c_str(), 0777);
  ::lchown(given->url().c_str(), 1234, 1234);
  ::removexattr(sys->url().c_str(), "system.posix_acl_access");
  std::string leftover = staging() + "/" + VSAUUID::random().string();
  fs::create_directories(leftover);
  auto& config = *context_->globalConfiguration;
  std::string journal = config.replaceDirectory() + "/journal.plist";
  put(journal, "half");
  std::string updates = config.pendingUpdatesDirectory();
  put(updates + "/.tmp-123", "half");
  put(updates + "/junk.plist", "not a property list");
  VSADataProtectionUpdate ghost;
  ghost.identifier = "com.example.ghost";
  ghost.containerClass = VSAClass::kDataApplication;
  ghost.protectionClass = 3;
  ghost.internalID = VSAUUID::random();
  ghost.userIdentity = user_;
  std::string ghostFile = updates + "/com.example.ghost-2-501.plist";
  ASSERT_TRUE(VSAWriteDataProtectionUpdate(ghost, ghostFile, *context_->fileManager,
                                           kVSANoProtectionClass, 0600, nullptr));
  context_.reset();

  VSARootChecker checker(root_);
  ASSERT_EQ(checker.check(), VSARootChecker::kFindings);
  auto found = byKind(checker);
  EXPECT_EQ(found["orphan"], (std::set<std::string>{orphan, classDir + "/not-a-container"}));
  EXPECT_EQ(found["invalid-metadata"], std::set<std::string>{broken->url()});
  EXPECT_EQ(found["duplicate-identity"].size(), 1u);
  EXPECT_EQ(found["duplicate-uuid"].size(), 1u);
  EXPECT_TRUE(found["duplicate-identity"].count(twin) ||
              found["duplicate-identity"].count(copied->url()));
  EXPECT_EQ(found["mode"], std::set<std::string>{opened->url()});
  // The twin was copied by root: it is root's too.
  EXPECT_EQ(found["owner"], (std::set<std::string>{given->url(), twin}));
  EXPECT_EQ(found["acl"], std::set<std::string>{sys->url()});
  EXPECT_EQ(found["staging-leftover"], std::set<std::string>{leftover});
  EXPECT_EQ(found["replace-journal"], std::set<std::string>{journal});
  EXPECT_EQ(found["unfinished-write"], std::set<std::string>{updates + "/.tmp-123"});
  EXPECT_EQ(found["invalid-pending-update"], std::set<std::string>{updates + "/junk.plist"});
  EXPECT_EQ(found["pending-update-without-container"], std::set<std::string>{ghostFile});
  EXPECT_EQ(found.size(), 12u) << checker.text();
}

TEST_F(RootChecker, ARootItCannotReadIsStatusTwo) {
  made("com.example.app");
  std::string library = context_->globalConfiguration->libraryDirectory();
  context_.reset();
  // A database that is not one.
  for (const char* suffix : {"", "-wal", "-shm"})
    fs::remove(library + "/containers.sqlite3" + suffix);
  put(library + "/containers.sqlite3", std::string(8192, 'x'));
  VSARootChecker damaged(root_);
  EXPECT_EQ(damaged.check(), VSARootChecker::kUnreadable);
  EXPECT_NE(damaged.unreadableReason().find("code-signing database"), std::string::npos);
  // A root some daemon is serving.
  fs::remove(library + "/containers.sqlite3");
  fs::create_directories(root_ + "/run/vessad");
  int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::string socketPath = root_ + "/run/vessad/com.tamsk.vessad";
  std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", socketPath.c_str());
  ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
  ASSERT_EQ(::listen(fd, 4), 0);
  VSARootChecker served(root_);
  EXPECT_EQ(served.check(), VSARootChecker::kUnreadable);
  EXPECT_NE(served.unreadableReason().find("serving"), std::string::npos);
  ::close(fd);
  VSARootChecker nothing(root_ + "/does-not-exist");
  EXPECT_EQ(nothing.check(), VSARootChecker::kUnreadable);
}

}  // namespace
