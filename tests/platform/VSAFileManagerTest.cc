#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "platform/VSAFaultInjectingFileSystem.h"
#include "platform/VSAFileManager.h"
#include "platform/VSALinuxFileSystem.h"

namespace fs = std::filesystem;
using Op = VSAFileSystem::Op;

namespace {

class FileManager : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    fs::create_directories(root_ + "/etc");
    std::ofstream(root_ + "/etc/group") << "systemusers:x:600:\n";
    base_ = root_ + "/container";
    fs::create_directories(base_ + "/Documents/sub");
    faults_ = std::make_shared<VSAFaultInjectingFileSystem>(
        std::make_shared<VSALinuxFileSystem>([this] { return locked_; }));
    fm_ = std::make_unique<VSAFileManager>(faults_,
                                           std::make_shared<VSAUserDatabase>(VSASystemRoot(root_)));
  }
  void file(const std::string& path, const std::string& text = "x") {
    fs::create_directories(fs::path(path).parent_path());
    std::ofstream(path) << text;
  }
  std::string real(const std::string& p) { return fs::canonical(p).string(); }

  VSATestTempDir temp_{"vessa-fm"};
  std::string root_, base_;
  bool locked_ = false;
  std::shared_ptr<VSAFaultInjectingFileSystem> faults_;
  std::unique_ptr<VSAFileManager> fm_;
};

TEST_F(FileManager, ClientPathsStayInsideTheBase) {
  file(base_ + "/Documents/a.txt");
  EXPECT_EQ(fm_->realPathForURL(base_ + "/Documents/a.txt", base_),
            real(base_ + "/Documents/a.txt"));
  // ".." is refused before any file-system access.
  int before = faults_->totalCalls();
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/Documents/../../x", base_));
  EXPECT_EQ(faults_->totalCalls(), before);
  EXPECT_FALSE(fm_->realPathForURL(root_ + "/elsewhere", base_));
  EXPECT_FALSE(fm_->realPathForURL("", base_));
  // Only paths strictly inside the base are answered, never the base itself.
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/", base_));
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/.", base_));
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/Documents/sub/../..", base_));
  // Relative link that stays inside: accepted; climbing out or to the base: refused.
  fs::create_directories(base_ + "/a");
  file(base_ + "/c");
  fs::create_symlink("../c", base_ + "/a/b");
  EXPECT_EQ(fm_->realPathForURL(base_ + "/a/b", base_), real(base_ + "/c"));
  fs::create_symlink("../../x", base_ + "/up");
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/up", base_));
  fs::create_symlink("..", base_ + "/a/tobase");
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/a/tobase", base_));
  fs::create_symlink(base_ + "/c", base_ + "/absolute");
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/absolute", base_)) << "absolute links are refused";
  // A directory link in the middle of the path that leads outside is caught
  // by comparing the real paths.
  fs::create_directories(root_ + "/outside");
  fs::create_directory_symlink("../outside", base_ + "/escape");
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/escape/secret", base_));
  // Link loops and overlong paths fail cleanly.
  fs::create_symlink("loop2", base_ + "/loop1");
  fs::create_symlink("loop1", base_ + "/loop2");
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/loop1/x", base_));
  EXPECT_FALSE(fm_->realPathForURL(base_ + "/" + std::string(5000, 'a'), base_));
}

TEST_F(FileManager, MissingTailResolvesThroughTheDeepestExistingPrefix) {
  auto r = fm_->realPathForURL(base_ + "/Documents/sub/new/deeper/file", base_);
  ASSERT_TRUE(r);
  EXPECT_EQ(*r, real(base_ + "/Documents/sub") + "/new/deeper/file");
}

TEST_F(FileManager, OnlyADirectoryTheCallMakesChangesHands) {
  std::ofstream(root_ + "/etc/passwd") << "mobile:x:501:777::/private/var/mobile:/bin/false\n";
  std::string dir = base_ + "/Documents";  // there already, root's
  VSAErrorRef error;
  ASSERT_TRUE(fm_->createDirectoryAtURL(dir, false, 0755, 501, 3, &error));
  struct stat st;
  ASSERT_EQ(lstat(dir.c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 0u) << "an existing directory keeps its owner";
  ASSERT_TRUE(fm_->createDirectoryAtURL(base_ + "/New/Inner", true, 0755, 501, 3, &error));
  ASSERT_EQ(lstat((base_ + "/New/Inner").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(st.st_gid, 777u) << "the owner's primary group, not its uid";
  ASSERT_TRUE(fm_->createDirectoryAtURL(base_ + "/Grouped", true, 0755, 501, 3, &error, 12));
  ASSERT_EQ(lstat((base_ + "/Grouped").c_str(), &st), 0);
  EXPECT_EQ(st.st_gid, 12u);
  int cls = 0;
  ASSERT_TRUE(fm_->dataProtectionClassOfItemAtURL(dir, &cls, &error));
  EXPECT_EQ(cls, 3);
  ASSERT_TRUE(
      fm_->createDirectoryAtURL(base_ + "/x/y/z", true, 0700, 0, kVSANoProtectionClass, &error));
  ASSERT_EQ(lstat((base_ + "/x/y/z").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);
  file(base_ + "/plainfile");
  EXPECT_FALSE(fm_->createDirectoryAtURL(base_ + "/plainfile/d", true, 0755, 0,
                                         kVSANoProtectionClass, &error));
  EXPECT_FALSE(fm_->createDirectoryAtURL(base_ + "/plainfile", true, 0755, 0, kVSANoProtectionClass,
                                         &error));
  EXPECT_EQ(error->underlyingError() ? error->underlyingError()->code() : error->code(), ENOTDIR);
  ASSERT_EQ(symlink((base_ + "/x").c_str(), (base_ + "/link").c_str()), 0);
  EXPECT_FALSE(
      fm_->createDirectoryAtURL(base_ + "/link", true, 0755, 0, kVSANoProtectionClass, &error))
      << "a link to a directory is not a directory";
}

// A directory is made from the bottom up: the cost does not grow with the
// depth of the path when the parents exist.
TEST_F(FileManager, IntermediateDirectoriesAreMadeOnlyWhereMissing) {
  VSAErrorRef error;
  std::string deep = base_ + "/a/b/c/d/e/f/g";
  faults_->reset();
  ASSERT_TRUE(fm_->createDirectoryAtURL(deep, true, 0755, 0, kVSANoProtectionClass, &error));
  EXPECT_TRUE(std::filesystem::is_directory(deep));
  EXPECT_LE(faults_->callCount(VSAFileSystem::Op::Mkdir), 15) << "climbs only as far as needed";
  faults_->reset();
  ASSERT_TRUE(fm_->createDirectoryAtURL(deep + "/h", true, 0755, 0, kVSANoProtectionClass, &error));
  EXPECT_EQ(faults_->callCount(VSAFileSystem::Op::Mkdir), 1);
  faults_->reset();
  ASSERT_TRUE(fm_->createDirectoryAtURL(deep, true, 0755, 0, kVSANoProtectionClass, &error));
  EXPECT_EQ(faults_->callCount(VSAFileSystem::Op::Mkdir), 1);
  EXPECT_EQ(faults_->callCount(VSAFileSystem::Op::Lstat), 1);
  faults_->reset();
  faults_->failNth(VSAFileSystem::Op::Mkdir, 2, EACCES);
  EXPECT_FALSE(
      fm_->createDirectoryAtURL(base_ + "/p/q", true, 0755, 0, kVSANoProtectionClass, &error))
      << "a parent that cannot be made fails the whole path";
  EXPECT_FALSE(std::filesystem::exists(base_ + "/p"));
}

TEST_F(FileManager, ProtectionClassRefusesChangesWhileLocked) {
  file(base_ + "/f");
  VSAErrorRef error;
  ASSERT_TRUE(fm_->setDataProtectionClassOfItemAtURL(base_ + "/f", 2, nullptr, &error));
  locked_ = true;
  EXPECT_FALSE(fm_->setDataProtectionClassOfItemAtURL(base_ + "/f", 4, nullptr, &error));
  EXPECT_EQ(error->code(), VSAFileSystem::kDeviceLockedError);
  // The predicate sees the current class and can decline the change.
  locked_ = false;
  int seen = -1;
  ASSERT_TRUE(fm_->setDataProtectionClassOfItemAtURL(
      base_ + "/f", 4,
      [&](int c) {
        seen = c;
        return false;
      },
      &error));
  EXPECT_EQ(seen, 2);
  int cls = 0;
  fm_->dataProtectionClassOfItemAtURL(base_ + "/f", &cls, &error);
  EXPECT_EQ(cls, 2);
}

TEST_F(FileManager, RemovalGoesOnPastErrorsAndReportsTheFirst) {
  for (int i = 0; i < 5; ++i) file(base_ + "/Documents/f" + std::to_string(i));
  faults_->failNth(Op::Unlink, 2, EIO);
  VSAErrorRef error;
  EXPECT_FALSE(fm_->removeItemAtURL(base_, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), EIO);
  int left = 0;
  for (auto& e : fs::recursive_directory_iterator(base_)) left += e.is_regular_file();
  EXPECT_EQ(left, 1) << "only the file that failed is left";
  EXPECT_TRUE(fm_->removeItemAtURL(base_, &error));
  EXPECT_FALSE(fs::exists(base_));
  EXPECT_TRUE(fm_->removeItemAtURL(base_, &error)) << "a missing item is success";
}

TEST_F(FileManager, RemovalTellsItsObserverEachFileAndItsSize) {
  file(base_ + "/Documents/a", std::string(1000, 'a'));
  file(base_ + "/Library/deep/b", std::string(24, 'b'));
  file(base_ + "/c", "");
  faults_->failNth(Op::Unlink, 3, EIO);  // what that leaves is not counted
  uint64_t files = 0, bytes = 0;
  VSAErrorRef error;
  EXPECT_FALSE(fm_->removeItemAtURL(base_, &error, [&](uint64_t size) { ++files, bytes += size; }));
  uint64_t left = 0, leftFiles = 0;
  for (auto& e : fs::recursive_directory_iterator(base_))
    if (e.is_regular_file()) left += e.file_size(), ++leftFiles;
  EXPECT_EQ(files + leftFiles, 3u) << "every file is either reported removed or still there";
  EXPECT_EQ(bytes + left, 1024u);
}

TEST_F(FileManager, RemovalClearsTheImmutableFlag) {
  file(base_ + "/Documents/locked");
  auto linux = std::make_shared<VSALinuxFileSystem>();
  int flags = 0;
  if (linux->getFlags(base_ + "/Documents/locked", &flags) != 0 ||
      linux->setFlags(base_ + "/Documents/locked", flags | VSAFileSystem::kImmutableFlag) != 0)
    GTEST_SKIP() << "this file system or user cannot set the immutable flag";
  ASSERT_NE(unlink((base_ + "/Documents/locked").c_str()), 0)
      << "the flag really protects the file";
  VSAErrorRef error;
  EXPECT_TRUE(fm_->removeItemAtURL(base_, &error)) << (error ? error->description() : "");
  EXPECT_FALSE(fs::exists(base_));
}

TEST_F(FileManager, MoveAcrossDevicesCopiesThenRemoves) {
  file(base_ + "/Documents/a", "hello");
  setxattr((base_ + "/Documents/a").c_str(), "user.note", "n", 1, 0);
  fs::create_symlink("a", base_ + "/Documents/link");
  chmod((base_ + "/Documents/a").c_str(), 0640);
  faults_->failNth(Op::Rename, 1, EXDEV);
  VSAErrorRef error;
  ASSERT_TRUE(fm_->moveItemAtURL(base_, root_ + "/moved", &error));
  EXPECT_FALSE(fs::exists(base_));
  std::ifstream in(root_ + "/moved/Documents/a");
  std::string text;
  in >> text;
  EXPECT_EQ(text, "hello");
  char note[8] = {};
  EXPECT_EQ(getxattr((root_ + "/moved/Documents/a").c_str(), "user.note", note, sizeof note), 1);
  EXPECT_TRUE(fs::is_symlink(root_ + "/moved/Documents/link")) << "links are copied, not followed";
  struct stat st;
  lstat((root_ + "/moved/Documents/a").c_str(), &st);
  EXPECT_EQ(st.st_mode & 0777, 0640u);
  // A source that cannot be removed afterwards still counts as moved.
  file(root_ + "/src2/f");
  faults_->failNth(Op::Rename, 1, EXDEV);
  faults_->failAll(Op::Unlink, EACCES);
  EXPECT_TRUE(fm_->moveItemAtURL(root_ + "/src2", root_ + "/dst2", &error));
  EXPECT_TRUE(fs::exists(root_ + "/dst2/f"));
  faults_->reset();
  EXPECT_TRUE(fm_->moveItemIfExistsAtURL(root_ + "/nothing", root_ + "/dst3", &error));
  EXPECT_FALSE(fm_->moveItemAtURL(root_ + "/nothing", root_ + "/dst3", &error));
}

TEST_F(FileManager, NormalisationLeavesTheMetadataFileAlone) {
  std::string metadata = base_ + "/" + kVSAMetadataFileName;
  file(metadata);
  chmod(metadata.c_str(), 0600);
  file(base_ + "/Documents/data");
  file(base_ + "/Documents/tool");
  chmod((base_ + "/Documents/tool").c_str(), 0700);
  VSAErrorRef error;
  ASSERT_TRUE(fm_->standardizeOwnershipAtURL(base_, 501, 502, &error));
  struct stat st;
  lstat((base_ + "/Documents/data").c_str(), &st);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(st.st_gid, 502u);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  lstat((base_ + "/Documents/tool").c_str(), &st);
  EXPECT_EQ(st.st_mode & 0777, 0755u);
  lstat(metadata.c_str(), &st);
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  // System-container ACLs: the tree gets the ACLs and owner -2, the metadata file does not.
  ASSERT_TRUE(fm_->standardizeACLsForSystemContainerAtURL(base_, &error)) << error->description();
  char buf[256];
  EXPECT_GT(
      getxattr((base_ + "/Documents/data").c_str(), "system.posix_acl_access", buf, sizeof buf), 0);
  EXPECT_GT(getxattr((base_ + "/Documents").c_str(), "system.posix_acl_default", buf, sizeof buf),
            0)
      << "directories pass the ACL on to new children";
  EXPECT_GT(getxattr(base_.c_str(), "system.posix_acl_default", buf, sizeof buf), 0);
  EXPECT_LT(getxattr(metadata.c_str(), "system.posix_acl_access", buf, sizeof buf), 0);
  lstat((base_ + "/Documents/data").c_str(), &st);
  EXPECT_EQ(st.st_uid, kVSANobodyID);
  lstat(metadata.c_str(), &st);
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  // A new file in an ACL'd directory inherits the systemusers entry.
  file(base_ + "/Documents/new");
  EXPECT_GT(
      getxattr((base_ + "/Documents/new").c_str(), "system.posix_acl_access", buf, sizeof buf), 0);
}

TEST_F(FileManager, ListingHidesDotNamesAndWalkReportsEverything) {
  file(base_ + "/.hidden");
  file(base_ + "/visible");
  VSAErrorRef error;
  auto items = fm_->urlsForItemsInDirectoryAtURL(base_, &error);
  ASSERT_TRUE(items);
  std::set<std::string> names;
  for (auto& i : *items) names.insert(fs::path(i.path).filename().string());
  EXPECT_EQ(names, (std::set<std::string>{"Documents", "visible"}));
  EXPECT_FALSE(fm_->urlsForItemsInDirectoryAtURL(base_ + "/none", &error));
  int dirs = 0, ends = 0, others = 0;
  ASSERT_TRUE(
      fm_->traverseDirectory(base_, &error, [&](const VSAWalkItem&, VSAFileManager::WalkPhase w) {
        (w == VSAFileManager::WalkPhase::Directory      ? dirs
         : w == VSAFileManager::WalkPhase::DirectoryEnd ? ends
                                                        : others)++;
        return true;
      }));
  EXPECT_EQ(dirs, 3);
  EXPECT_EQ(ends, 3);
  EXPECT_EQ(others, 2);
  EXPECT_GT(fm_->diskUsageForURL(base_), 0u);
  auto tmp = fm_->createTemporaryDirectoryInDirectoryURL(base_, &error);
  ASSERT_TRUE(tmp);
  EXPECT_EQ(fs::path(*tmp).filename().string().rfind("temp.", 0), 0u);
}

}  // namespace

namespace {

TEST_F(FileManager, FastSizingFallsBackToTheFullWalk) {
  file(base_ + "/Documents/a", std::string(1000, 'x'));
  uint64_t full = fm_->diskUsageForURL(base_);
  // The statistics query fails (as it does without project quotas): the
  // answer is the full walk's, after one attempt to turn statistics on.
  faults_->failAll(Op::DirectoryStatistics, ESRCH);
  EXPECT_EQ(fm_->fastDiskUsageForURL(base_), full);
  EXPECT_EQ(faults_->callCount(Op::MaintainStatistics), 1);
  faults_->reset();
  uint64_t bytes = 0;
  auto linux = std::make_shared<VSALinuxFileSystem>();
  if (linux->maintainDirectoryStatistics(base_) != 0 ||
      linux->directoryStatistics(base_, &bytes) != 0)
    GTEST_SKIP() << "this file system keeps no project quota accounting";
  EXPECT_GT(fm_->fastDiskUsageForURL(base_), 0u);
}

// Under the fault-injecting layer's power-loss model: what a durable
// creation makes, and a staged tree synced before its commit, survive the
// power failing right after; the plain forms do not.
TEST_F(FileManager, DurableDirectoriesAndSyncedTreesOutliveAPowerLoss) {
  using CrashModel = VSAFaultInjectingFileSystem::CrashModel;
  VSAErrorRef error;
  faults_->crashAfter(1 << 20, CrashModel::PowerLoss);
  ASSERT_TRUE(
      fm_->createDirectoryAtURL(root_ + "/plain/a/b", true, 0755, 0, kVSANoProtectionClass, &error))
      << error;
  ASSERT_TRUE(fm_->createDurableDirectoryAtURL(root_ + "/durable/a/b", 0755, 0,
                                               kVSANoProtectionClass, &error))
      << error;
  for (const char* name : {"synced", "unsynced"}) {
    std::string staged = root_ + "/staging-" + name;
    ASSERT_TRUE(fm_->createDirectoryAtURL(staged + "/Library/Caches", true, 0755, 0,
                                          kVSANoProtectionClass, &error))
        << error;
    if (std::string(name) == "synced") {
      ASSERT_TRUE(fm_->syncDirectoriesAtURL(staged, &error)) << error;
    }
    ASSERT_TRUE(fm_->moveItemAtURL(staged, base_ + "/" + name, &error)) << error;
  }
  faults_->crashNow();
  faults_->reset();
  EXPECT_FALSE(fs::exists(base_ + "/Documents/plain"));
  EXPECT_TRUE(fs::is_directory(root_ + "/durable/a/b"));
  EXPECT_TRUE(fs::is_directory(base_ + "/synced/Library/Caches"));
  // The commit's rename made the staged directory's own entry durable only.
  EXPECT_TRUE(fs::is_directory(base_ + "/unsynced"));
  EXPECT_FALSE(fs::exists(base_ + "/unsynced/Library"));
}

}  // namespace
