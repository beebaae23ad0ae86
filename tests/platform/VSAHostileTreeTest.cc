// Trees that their owner changes while root walks them: a directory swapped
// for a link between the daemon's listing and its next step, links in the
// middle of a path, trees deeper than any walk should follow.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "platform/VSAFileManager.h"
#include "platform/VSALinuxFileSystem.h"

namespace fs = std::filesystem;

namespace {

// Once the directory with inode `target` has been listed, renames it aside
// and puts a link to `outside` in its place: the moment an attacker would
// pick, made deterministic.
class SwappingFileSystem : public VSALinuxFileSystem {
 public:
  void arm(const std::string& victim, const std::string& outside) {
    victim_ = victim;
    outside_ = outside;
    struct stat st;
    ASSERT_EQ(::lstat(victim.c_str(), &st), 0);
    target_ = st.st_ino;
  }
  bool swapped() const { return swapped_; }

  int readDirectory(const std::string& path, std::vector<VSADirectoryEntry>* entries) override {
    int rc = VSALinuxFileSystem::readDirectory(path, entries);
    struct stat st;
    if (rc == 0 && ::lstat(path.c_str(), &st) == 0) maybeSwap(st.st_ino);
    return rc;
  }
  int readDirectoryAt(int dir, std::vector<VSADirectoryEntry>* entries) override {
    int rc = VSALinuxFileSystem::readDirectoryAt(dir, entries);
    struct stat st;
    if (rc == 0 && ::fstat(dir, &st) == 0) maybeSwap(st.st_ino);
    return rc;
  }

 private:
  void maybeSwap(ino_t listed) {
    if (swapped_ || listed != target_) return;
    swapped_ = true;
    fs::rename(victim_, victim_ + ".moved");
    fs::create_directory_symlink(outside_, victim_);
  }

  std::string victim_, outside_;
  ino_t target_ = 0;
  bool swapped_ = false;
};

class HostileTree : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    fs::create_directories(root_ + "/etc");
    std::ofstream(root_ + "/etc/group") << "systemusers:x:600:\n";
    outside_ = root_ + "/outside";
    fs::create_directories(outside_);
    std::ofstream(outside_ + "/secret") << "keep me";
    container_ = root_ + "/Containers/Data/victim";
    fs::create_directories(container_ + "/dir");
    std::ofstream(container_ + "/dir/secret") << "app data";
    swapper_ = std::make_shared<SwappingFileSystem>();
    fm_ = std::make_unique<VSAFileManager>(swapper_,
                                           std::make_shared<VSAUserDatabase>(VSASystemRoot(root_)));
  }
  uid_t ownerOf(const std::string& path) {
    struct stat st;
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st.st_uid;
  }

  VSATestTempDir temp_{"vessa-hostile"};
  std::string root_, outside_, container_;
  std::shared_ptr<SwappingFileSystem> swapper_;
  std::unique_ptr<VSAFileManager> fm_;
};

TEST_F(HostileTree, RemovalNeverFollowsADirectorySwappedForALink) {
  swapper_->arm(container_ + "/dir", outside_);
  VSAErrorRef error;
  fm_->removeItemAtURL(container_, &error);
  ASSERT_TRUE(swapper_->swapped());
  EXPECT_TRUE(fs::exists(outside_ + "/secret")) << "root removed a file outside the tree";
  // What was really in the listed directory went, wherever it was moved; the
  // planted link is an entry like any other and is removed as one.
  EXPECT_FALSE(fs::exists(container_ + "/dir.moved/secret"));
  EXPECT_FALSE(fs::is_symlink(container_ + "/dir"));
}

TEST_F(HostileTree, OwnershipWalkNeverFollowsADirectorySwappedForALink) {
  swapper_->arm(container_ + "/dir", outside_);
  VSAErrorRef error;
  fm_->standardizeOwnershipAtURL(container_, 501, 501, &error);
  ASSERT_TRUE(swapper_->swapped());
  EXPECT_EQ(ownerOf(outside_ + "/secret"), 0u) << "root gave away a file outside the tree";
  EXPECT_EQ(ownerOf(outside_), 0u);
}

TEST_F(HostileTree, ACLWalkNeverFollowsADirectorySwappedForALink) {
  swapper_->arm(container_ + "/dir", outside_);
  struct stat before;
  ASSERT_EQ(::lstat((outside_ + "/secret").c_str(), &before), 0);
  VSAErrorRef error;
  fm_->standardizeACLsAtURL(container_, true, &error);
  ASSERT_TRUE(swapper_->swapped());
  struct stat after;
  ASSERT_EQ(::lstat((outside_ + "/secret").c_str(), &after), 0);
  EXPECT_EQ(after.st_uid, before.st_uid);
  EXPECT_EQ(after.st_mode, before.st_mode) << "an ACL was written outside the tree";
}

TEST_F(HostileTree, NoCallGoesThroughALinkInTheMiddleOfAPath) {
  // The user's own directory swapped for a link to a root-owned place.
  fs::rename(root_ + "/Containers/Data", root_ + "/Containers/Data.real");
  fs::create_directory_symlink(outside_, root_ + "/Containers/Data");
  std::string through = root_ + "/Containers/Data/Application";
  VSAErrorRef error;
  EXPECT_FALSE(fm_->createDirectoryAtURL(through, true, 0755, 501, 3, &error));
  EXPECT_FALSE(fs::exists(outside_ + "/Application")) << "a directory was made outside";
  EXPECT_NE(fm_->fileSystem().lchown(root_ + "/Containers/Data/secret", 501, 501), 0);
  EXPECT_EQ(ownerOf(outside_ + "/secret"), 0u);
  EXPECT_EQ(fm_->fileSystem().unlink(root_ + "/Containers/Data/secret"), ELOOP);
  EXPECT_TRUE(fs::exists(outside_ + "/secret"));
  EXPECT_FALSE(fm_->moveItemAtURL(root_ + "/Containers/Data/secret", root_ + "/stolen", &error));
  EXPECT_TRUE(fs::exists(outside_ + "/secret"));
  std::vector<uint8_t> bytes{'x'};
  EXPECT_EQ(fm_->fileSystem().writeFile(root_ + "/Containers/Data/planted", bytes, 0644), ELOOP);
  EXPECT_FALSE(fs::exists(outside_ + "/planted"));
  // The link itself, as the last name, is an entry: removed, not followed.
  EXPECT_TRUE(fm_->removeItemAtURL(root_ + "/Containers/Data", &error));
  EXPECT_TRUE(fs::exists(outside_ + "/secret"));
}

TEST_F(HostileTree, ExistenceAnswersAsLstatWithoutFollowingLinks) {
  fs::create_symlink(outside_ + "/secret", container_ + "/final-link");
  fs::create_symlink(root_ + "/nowhere", container_ + "/dangling-link");
  fs::create_directory_symlink(outside_, container_ + "/dir-link");
  mkfifo((container_ + "/fifo").c_str(), 0644);
  VSALinuxFileSystem linux;
  struct Case {
    std::string path;
    int expected;
  };
  std::vector<Case> cases = {
      {container_ + "/dir/secret", 0},
      {container_ + "/dir", 0},
      {container_ + "/fifo", 0},  // opened as a path: never blocks
      {container_ + "/final-link", 0},
      {container_ + "/dangling-link", 0},
      {container_ + "/dir-link/secret", ELOOP},  // what lies behind a link is not reached
      {container_ + "/missing", ENOENT},
      {container_ + "/missing/deeper", ENOENT},
      {container_ + "/dir/secret/below-a-file", ENOTDIR},
      {container_ + "/dir/", 0},
      {container_ + "/dir/..", EINVAL},
  };
  for (const Case& c : cases) {
    struct stat st;
    EXPECT_EQ(linux.exists(c.path), c.expected) << c.path;
    EXPECT_EQ(linux.lstat(c.path, &st), c.expected) << c.path << " (lstat)";
  }
  EXPECT_TRUE(fm_->itemExistsAtURL(container_ + "/dangling-link"));
  EXPECT_FALSE(fm_->itemExistsAtURL(container_ + "/dir-link/secret"));
  EXPECT_FALSE(fm_->itemDoesNotExistAtURL(container_ + "/dir-link/secret"))
      << "a link in the way is not the same as an absent item";
  EXPECT_TRUE(fm_->itemDoesNotExistAtURL(container_ + "/missing"));
}

TEST_F(HostileTree, SingleFileRemovalRefusesATree) {
  VSAErrorRef error;
  EXPECT_FALSE(fm_->removeFileAtURL(container_ + "/dir", &error));
  EXPECT_TRUE(fs::exists(container_ + "/dir/secret"));
  EXPECT_TRUE(fm_->removeFileAtURL(container_ + "/dir/secret", &error));
  EXPECT_TRUE(fm_->removeFileAtURL(container_ + "/dir/secret", &error)) << "missing is success";
}

TEST_F(HostileTree, TreesDeeperThanTheLimitAreRefusedNotFollowed) {
  // Built with descriptors: the full path is longer than PATH_MAX.
  int dir = ::open(container_.c_str(), O_RDONLY | O_DIRECTORY);
  ASSERT_GE(dir, 0);
  for (int i = 0; i < kVSAMaxWalkDepth + 20; ++i) {
    ASSERT_EQ(::mkdirat(dir, "d", 0755), 0);
    int next = ::openat(dir, "d", O_RDONLY | O_DIRECTORY);
    ::close(dir);
    ASSERT_GE(next, 0);
    dir = next;
  }
  ::close(dir);
  VSAErrorRef error;
  size_t seen = 0;
  EXPECT_FALSE(fm_->traverseDirectory(container_, &error, [&](const VSAWalkItem&, auto) {
    ++seen;
    return true;
  }));
  EXPECT_GT(seen, static_cast<size_t>(kVSAMaxWalkDepth));
  EXPECT_FALSE(fm_->removeItemAtURL(container_, &error));
  EXPECT_EQ(error->underlyingError() ? error->underlyingError()->code() : error->code(), ELOOP);
  EXPECT_TRUE(fs::exists(container_ + "/d")) << "the part within reach stays for the caller";
}

TEST_F(HostileTree, AnItemGivenToRootCannotBeReachedByItsOwner) {
  ASSERT_EQ(::chown(container_.c_str(), 501, 501), 0);
  ASSERT_EQ(::chmod(container_.c_str(), 0777), 0);
  VSAErrorRef error;
  ASSERT_TRUE(fm_->restrictItemToRootAtURL(container_, &error));
  struct stat st;
  ASSERT_EQ(::lstat(container_.c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 0u);
  EXPECT_EQ(st.st_gid, 0u);
  EXPECT_EQ(st.st_mode & 07777, 0700u);
}

}  // namespace
