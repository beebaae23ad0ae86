// The two crash models of the fault-injecting file system, on a real
// directory: a process death keeps whatever reached the disk; a power loss
// takes back what was not made durable, as VSAFileSystem's calls promise it.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "platform/VSAFaultInjectingFileSystem.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSAUniqueFd.h"

namespace fs = std::filesystem;
using CrashModel = VSAFaultInjectingFileSystem::CrashModel;

namespace {

class FaultInjectingFileSystem : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    faults_ = std::make_shared<VSAFaultInjectingFileSystem>(std::make_shared<VSALinuxFileSystem>());
  }
  std::string at(const std::string& relative) const { return root_ + "/" + relative; }
  static std::vector<uint8_t> bytes(const std::string& text) { return {text.begin(), text.end()}; }
  static std::string read(const std::string& path) {
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
  // Opens a directory through the layer, as the daemon does.
  VSAUniqueFd open(const std::string& path) {
    int fd = -1;
    EXPECT_EQ(faults_->openDirectory(path, &fd), 0) << path;
    return VSAUniqueFd(fd);
  }
  void sync(const std::string& path) { EXPECT_EQ(faults_->syncDirectory(open(path).get()), 0); }
  // A power loss from now on, after as many calls as a test makes.
  void armPowerLoss() { faults_->crashAfter(1000, CrashModel::PowerLoss); }

  VSATestTempDir temp_{"vessa-faults"};
  std::string root_;
  std::shared_ptr<VSAFaultInjectingFileSystem> faults_;
};

TEST_F(FaultInjectingFileSystem, AFileRenamedIntoPlaceWithoutADirectorySyncIsLost) {
  fs::create_directories(at("d"));
  armPowerLoss();
  ASSERT_EQ(faults_->writeFile(at("d/.tmp"), bytes("new"), 0600), 0);
  ASSERT_EQ(faults_->renameWithoutSync(at("d/.tmp"), at("d/file")), 0);
  faults_->crashNow();
  EXPECT_FALSE(fs::exists(at("d/file")));
  EXPECT_FALSE(fs::exists(at("d/.tmp")));
  EXPECT_TRUE(fs::is_directory(at("d")));  // made before the crash was planned: durable
}

TEST_F(FaultInjectingFileSystem, ADirectorySyncOrACommittingRenameKeepsIt) {
  fs::create_directories(at("d"));
  armPowerLoss();
  ASSERT_EQ(faults_->writeFile(at("d/.tmp-1"), bytes("one"), 0600), 0);
  ASSERT_EQ(faults_->renameWithoutSync(at("d/.tmp-1"), at("d/synced")), 0);
  sync(at("d"));
  // rename syncs the destination's directory: a commit of its own.
  ASSERT_EQ(faults_->writeFile(at("d/.tmp-2"), bytes("two"), 0600), 0);
  ASSERT_EQ(faults_->rename(at("d/.tmp-2"), at("d/committed")), 0);
  faults_->crashNow();
  EXPECT_EQ(read(at("d/synced")), "one");
  EXPECT_EQ(read(at("d/committed")), "two");
}

TEST_F(FaultInjectingFileSystem, AnUnsyncedRenameIsUndoneAndASyncOfEitherSideKeepsIt) {
  for (const char* dir : {"a", "b", "c", "d"}) fs::create_directories(at(dir));
  std::ofstream(at("a/one")) << "1";
  std::ofstream(at("c/two")) << "2";
  std::ofstream(at("c/three")) << "3";
  armPowerLoss();
  ASSERT_EQ(faults_->renameWithoutSync(at("a/one"), at("b/one")), 0);
  ASSERT_EQ(faults_->renameWithoutSync(at("b/one"), at("b/uno")), 0);  // undone in reverse order
  {
    VSAUniqueFd c = open(at("c")), d = open(at("d"));
    ASSERT_EQ(faults_->renameAt(c.get(), "two", d.get(), "two"), 0);  // a commit
  }
  ASSERT_EQ(faults_->renameWithoutSync(at("c/three"), at("d/three")), 0);
  sync(at("c"));  // the source's side: the journal carries the whole rename
  faults_->crashNow();
  EXPECT_EQ(read(at("a/one")), "1");
  EXPECT_FALSE(fs::exists(at("b/one")));
  EXPECT_FALSE(fs::exists(at("b/uno")));
  EXPECT_EQ(read(at("d/two")), "2");
  EXPECT_EQ(read(at("d/three")), "3");
  EXPECT_FALSE(fs::exists(at("c/three")));
}

TEST_F(FaultInjectingFileSystem, ADirectoryWhoseOwnEntryWasNeverSyncedVanishesWithItsContent) {
  fs::create_directories(at("parent"));
  armPowerLoss();
  ASSERT_EQ(faults_->mkdir(at("parent/made"), 0755), 0);
  ASSERT_EQ(faults_->mkdir(at("parent/made/inner"), 0755), 0);
  ASSERT_EQ(faults_->writeFile(at("parent/made/inner/file"), bytes("x"), 0600), 0);
  // Everything inside is durable; the parent's entry for "made" is not.
  sync(at("parent/made/inner"));
  sync(at("parent/made"));
  faults_->crashNow();
  EXPECT_TRUE(fs::is_directory(at("parent")));
  EXPECT_FALSE(fs::exists(at("parent/made")));
}

TEST_F(FaultInjectingFileSystem, ADirectoryWhoseEntryWasSyncedKeepsOnlyItsSyncedContent) {
  fs::create_directories(at("parent"));
  armPowerLoss();
  ASSERT_EQ(faults_->mkdir(at("parent/kept"), 0755), 0);
  ASSERT_EQ(faults_->mkdir(at("parent/kept/inner"), 0755), 0);
  ASSERT_EQ(faults_->writeFile(at("parent/kept/inner/file"), bytes("y"), 0600), 0);
  sync(at("parent/kept/inner"));
  sync(at("parent"));
  // "kept" itself was never synced: its entry for "inner" goes, with the
  // synced file below it.
  faults_->crashNow();
  EXPECT_TRUE(fs::is_directory(at("parent/kept")));
  EXPECT_FALSE(fs::exists(at("parent/kept/inner")));
}

// A directory built in staging and committed by a rename into place: the
// rename is durable, what was made inside the staged directory is not
// unless that directory was synced first, wherever it has moved since.
TEST_F(FaultInjectingFileSystem, WhatWasMadeInAStagedDirectoryFollowsItIntoPlace) {
  fs::create_directories(at("staging"));
  fs::create_directories(at("live"));
  for (bool syncFirst : {false, true}) {
    SCOPED_TRACE(syncFirst ? "synced before the commit" : "committed unsynced");
    std::string staged;
    armPowerLoss();
    ASSERT_EQ(faults_->mkdtemp(at("staging/temp.XXXXXX"), &staged), 0);
    ASSERT_EQ(faults_->writeFile(staged + "/metadata", bytes("m"), 0600), 0);
    {
      VSAUniqueFd dir = open(staged);
      ASSERT_EQ(faults_->mkdirAt(dir.get(), "Documents", 0700), 0);
      ASSERT_EQ(faults_->symlinkAt("Documents", dir.get(), "link"), 0);
      if (syncFirst) {
        ASSERT_EQ(faults_->syncDirectory(dir.get()), 0);
      }
    }
    std::string live = at(syncFirst ? "live/synced" : "live/unsynced");
    ASSERT_EQ(faults_->rename(staged, live), 0);
    faults_->crashNow();
    faults_->reset();
    EXPECT_TRUE(fs::is_directory(live));
    EXPECT_EQ(fs::exists(live + "/metadata"), syncFirst);
    EXPECT_EQ(fs::is_directory(live + "/Documents"), syncFirst);
    EXPECT_EQ(fs::is_symlink(live + "/link"), syncFirst);
  }
}

// copyDataAt syncs the copy's data, as writeFile does: only the new entry
// can be lost.
TEST_F(FaultInjectingFileSystem, ACopyKeepsItsDataAndLosesOnlyAnUnsyncedEntry) {
  fs::create_directories(at("from"));
  fs::create_directories(at("to"));
  std::ofstream(at("from/file")) << "content";
  armPowerLoss();
  {
    VSAUniqueFd from = open(at("from")), to = open(at("to"));
    ASSERT_EQ(faults_->copyDataAt(from.get(), "file", to.get(), "kept", 0600), 0);
    ASSERT_EQ(faults_->syncDirectory(to.get()), 0);
    ASSERT_EQ(faults_->copyDataAt(from.get(), "file", to.get(), "lost", 0600), 0);
  }
  faults_->crashNow();
  EXPECT_EQ(read(at("to/kept")), "content");
  EXPECT_FALSE(fs::exists(at("to/lost")));
  EXPECT_EQ(read(at("from/file")), "content");
}

TEST_F(FaultInjectingFileSystem, ThePowerFailsAtTheCallAfterTheCrashPoint) {
  fs::create_directories(at("d"));
  faults_->crashAfter(2, CrashModel::PowerLoss);
  EXPECT_EQ(faults_->mkdir(at("d/first"), 0755), 0);
  EXPECT_EQ(faults_->mkdir(at("d/second"), 0755), 0);
  EXPECT_TRUE(fs::exists(at("d/second")));  // the power has not failed yet
  struct stat st;
  EXPECT_EQ(faults_->lstat(at("d"), &st), EIO);  // the third call: the power fails
  EXPECT_TRUE(faults_->crashed());
  EXPECT_FALSE(fs::exists(at("d/first")));
  EXPECT_FALSE(fs::exists(at("d/second")));
  EXPECT_EQ(faults_->mkdir(at("d/third"), 0755), EIO);
  EXPECT_FALSE(fs::exists(at("d/third")));
  // After reset() nothing is tracked: a later crash of either kind keeps it.
  faults_->reset();
  EXPECT_EQ(faults_->mkdir(at("d/after"), 0755), 0);
  faults_->crashNow();
  EXPECT_TRUE(fs::exists(at("d/after")));
}

TEST_F(FaultInjectingFileSystem, AProcessDeathKeepsWhatReachedTheDisk) {
  fs::create_directories(at("d"));
  faults_->crashAfter(3);
  EXPECT_EQ(faults_->mkdir(at("d/made"), 0755), 0);
  EXPECT_EQ(faults_->writeFile(at("d/.tmp"), bytes("x"), 0600), 0);
  EXPECT_EQ(faults_->renameWithoutSync(at("d/.tmp"), at("d/file")), 0);
  EXPECT_EQ(faults_->mkdir(at("d/late"), 0755), EIO);
  EXPECT_TRUE(faults_->crashed());
  faults_->crashNow();
  EXPECT_TRUE(fs::is_directory(at("d/made")));
  EXPECT_EQ(read(at("d/file")), "x");
  EXPECT_FALSE(fs::exists(at("d/late")));
}

}  // namespace
