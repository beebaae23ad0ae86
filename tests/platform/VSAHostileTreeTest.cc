// Trees that their owner changes while root walks them: a directory swapped
// for a link between the daemon's listing and its next step (near the top,
// and deep down where the walk keeps no descriptor of the levels above),
// links in the middle of a path, trees deeper than any descriptor budget.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "platform/VSADirectoryStack.h"
#include "platform/VSAFileManager.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSAUniqueFd.h"

namespace fs = std::filesystem;

namespace {

// Once the directory with inode `target` has been listed, renames it aside
// and puts a link to `outside` in its place: the moment an attacker would
// pick, made deterministic.
class SwappingFileSystem : public VSALinuxFileSystem {
 public:
  // `movedTo`: where the listed directory goes (by default beside itself).
  void arm(const std::string& victim, const std::string& outside, std::string movedTo = "") {
    victim_ = victim;
    outside_ = outside;
    movedTo_ = movedTo.empty() ? victim + ".moved" : movedTo;
    swapped_ = false;
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
    fs::rename(victim_, movedTo_);
    fs::create_directory_symlink(outside_, victim_);
  }

  std::string victim_, outside_, movedTo_;
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

// Nests `depth` directories named `name` below `top`, each holding a
// one-byte file "f", built by descriptor (the full path may be longer than
// PATH_MAX).
void nest(const std::string& top, int depth, const std::string& name) {
  VSAUniqueFd dir(::open(top.c_str(), O_RDONLY | O_DIRECTORY));
  ASSERT_TRUE(dir);
  for (int i = 0; i < depth; ++i) {
    ASSERT_EQ(::mkdirat(dir.get(), name.c_str(), 0755), 0);
    VSAUniqueFd next(::openat(dir.get(), name.c_str(), O_RDONLY | O_DIRECTORY));
    ASSERT_TRUE(next);
    VSAUniqueFd file(::openat(next.get(), "f", O_WRONLY | O_CREAT, 0644));
    ASSERT_EQ(::write(file.get(), "x", 1), 1);
    dir = std::move(next);
  }
}
// Calls `level(fd, k)` for each level k = 0..depth of such a tree.
template <typename F>
void forEachLevel(const std::string& top, int depth, const std::string& name, F level) {
  VSAUniqueFd dir(::open(top.c_str(), O_RDONLY | O_DIRECTORY));
  for (int k = 0; dir && k <= depth; ++k) {
    level(dir.get(), k);
    if (k < depth) dir = VSAUniqueFd(::openat(dir.get(), name.c_str(), O_RDONLY | O_DIRECTORY));
  }
  ASSERT_TRUE(dir) << "the tree is not whole";
}
size_t openDescriptors() {
  return static_cast<size_t>(std::distance(fs::directory_iterator("/proc/self/fd"), {}));
}

// 600 levels: more than any descriptor budget, and a path far longer than
// PATH_MAX. Every tree operation reaches the bottom and keeps few
// descriptors open on the way.
TEST_F(HostileTree, TreesOfAnyDepthAreWalkedSizedCopiedReOwnedAndRemoved) {
  const int depth = 600;
  const std::string name = "nested-dir";
  std::string deep = container_ + "/deep", copy = container_ + "/copy";
  fs::create_directory(deep);
  nest(deep, depth, name);
  size_t baseline = openDescriptors(), most = 0;
  auto watch = [&] { most = std::max(most, openDescriptors()); };

  VSAErrorRef error;
  int directories = 0, files = 0;
  ASSERT_TRUE(fm_->traverseDirectory(deep, &error, [&](const VSAWalkItem&, auto phase) {
    directories += phase == VSAFileManager::WalkPhase::Directory;
    files += phase == VSAFileManager::WalkPhase::Item;
    watch();
    return true;
  })) << error;
  EXPECT_EQ(directories, depth + 1);
  EXPECT_EQ(files, depth);

  uint64_t bytes = 0;
  forEachLevel(deep, depth, name, [&](int dir, int k) {
    struct stat st;
    if (::fstat(dir, &st) == 0) bytes += st.st_size;
    if (k > 0 && ::fstatat(dir, "f", &st, AT_SYMLINK_NOFOLLOW) == 0) bytes += st.st_size;
  });
  EXPECT_EQ(fm_->diskUsageForURL(deep), bytes);

  ASSERT_TRUE(fm_->copyItemAtURL(deep, copy, &error)) << error;
  int copied = 0;
  forEachLevel(copy, depth, name, [&](int dir, int) {
    struct stat st;
    copied += ::fstatat(dir, "f", &st, AT_SYMLINK_NOFOLLOW) == 0 && st.st_size == 1;
  });
  EXPECT_EQ(copied, depth);

  EXPECT_TRUE(fm_->standardizeOwnershipAtURL(deep, 501, 501, &error)) << error;
  int given = 0;
  forEachLevel(deep, depth, name, [&](int dir, int k) {
    struct stat st;
    given += k > 0 && ::fstatat(dir, "f", &st, AT_SYMLINK_NOFOLLOW) == 0 && st.st_uid == 501;
  });
  EXPECT_EQ(given, depth);

  EXPECT_TRUE(fm_->standardizeACLsAtURL(deep, false, &error)) << error;
  int listed = 0;
  forEachLevel(deep, depth, name, [&](int dir, int k) {
    VSAUniqueFd file(k > 0 ? ::openat(dir, "f", O_RDONLY | O_NOFOLLOW) : -1);
    char buf[256];
    listed += file && ::fgetxattr(file.get(), "system.posix_acl_access", buf, sizeof buf) > 0;
  });
  EXPECT_EQ(listed, depth);

  int freed = 0;
  for (const std::string& tree : {deep, copy}) {
    EXPECT_TRUE(fm_->removeItemAtURL(tree, &error, [&](uint64_t) {
      ++freed;
      watch();
    })) << error;
    EXPECT_FALSE(fs::exists(tree));
  }
  EXPECT_EQ(freed, 2 * depth);
  EXPECT_LE(most - baseline, kVSAWalkDescriptorBudget + 4) << "descriptors grow with the depth";
}

// Deep below the descriptor budget, a directory is swapped for a link to
// outside once it has been listed, and moved to another parent, so that
// the way back up through its ".." leads elsewhere: the walk finds its way
// back by name from the top, and never through the link.
TEST_F(HostileTree, ADeepDirectorySwappedForALinkIsNotFollowed) {
  for (bool removal : {true, false}) {
    SCOPED_TRACE(removal ? "removal" : "ownership");
    std::string deep = container_ + (removal ? "/deep-removed" : "/deep-owned");
    std::string stolen = deep + ".stolen", victim = deep;
    fs::create_directory(deep);
    nest(deep, 400, "d");
    for (int i = 0; i < 350; ++i) victim += "/d";
    swapper_->arm(victim, outside_, stolen);
    VSAErrorRef error;
    if (removal)
      fm_->removeItemAtURL(deep, &error);
    else
      fm_->standardizeOwnershipAtURL(deep, 501, 501, &error);
    ASSERT_TRUE(swapper_->swapped());
    EXPECT_TRUE(fs::exists(outside_ + "/secret")) << "root removed a file outside the tree";
    EXPECT_EQ(ownerOf(outside_), 0u) << "root gave away a directory outside the tree";
    EXPECT_EQ(ownerOf(outside_ + "/secret"), 0u);
    if (removal) {
      // What was in the listed directory went, wherever it was moved; the
      // levels above it went too, the planted link with them.
      EXPECT_TRUE(fs::is_empty(stolen));
      EXPECT_FALSE(fs::exists(deep));
    } else {
      EXPECT_EQ(ownerOf(stolen + "/d/f"), 501u);
      EXPECT_EQ(ownerOf(deep + "/d/f"), 501u);
    }
  }
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
