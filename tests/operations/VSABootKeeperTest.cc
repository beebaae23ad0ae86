// Boot-time setup and cleanup: system containers restored from backups,
// orphaned class entries removed (and only they), system container
// directories renamed after an upgrade, group reconciliation in multi-user
// mode only, and an orphan scan that runs while a wipe replaces a container.
// Log lines are read from a rotating log file the test opens (VSATestLog).
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "VSAContainerTestRoot.h"
#include "VSAOldDevice.h"
#include "VSATestLog.h"
#include "base/VSALog.h"
#include "base/VSATestLocks.h"
#include "migration/VSAMigrationStatus.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSABootKeeper.h"
#include "operations/VSADeathRow.h"
#include "operations/VSASystemContainerRestore.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace {

class Boot : public VSAContainerTestRoot {
 protected:
  void SetUp() override {
    VSAContainerTestRoot::SetUp();
    ASSERT_TRUE(log_.open(root_ + "/test.log"));
  }
  bool logged(const std::string& text) { return log_.contains(text); }
  VSABootKeeper keeper() { return VSABootKeeper(*context_->operationServices); }
  void rebootSetup() { keeper().rebootKeeperSetup(installer()->grants()); }
  void rebootCleanup() {
    std::promise<void> done;
    installer()->rebootKeeperCleanupWithCompletion([&] { done.set_value(); });
    done.get_future().wait();
    context_->backgroundQueue->sync([] {});
  }
  std::shared_ptr<VSAPerUserConfiguration> perUser() {
    return context_->globalConfiguration->getPerUserConfigurationForUserIdentity(
        installer()->grants().clientUserIdentity);
  }
  // Where backups are restored from: the daemon's own directory.
  std::string library() {
    return context_->globalConfiguration->libraryDirectory() + "/" +
           kVSASystemContainerRestoreDirName;
  }
  void deviceFlags(const VSAValue& device) {
    fs::create_directories(root_ + "/etc/vessad");
    VSA_writeToURL(device, root_ + "/etc/vessad/device.plist", 0, nullptr);
    startContext();
  }
  VSATestLog log_;
};

TEST_F(Boot, BackedUpSystemContainersReplaceLiveItemsAndTheBackupGoes) {
  VSAResultCode code;
  auto live = create(*installer(), "com.example.sys", &code, false, VSAClass::kSystemData);
  ASSERT_TRUE(live) << code;
  put(live->url() + "/kept.txt", "live");
  put(live->url() + "/shared.txt", "live");
  std::string backup = perUser()->systemContainerBackupDirectory();
  fs::create_directories(backup + "/com.example.sys");
  fs::create_directories(backup + "/com.example.fresh/Library");
  put(backup + "/com.example.sys/shared.txt", "backup");
  put(backup + "/com.example.sys/" + kVSAMetadataFileName, "not the live identity");
  put(backup + "/com.example.fresh/Library/prefs", "fresh");

  rebootSetup();
  EXPECT_EQ(read(live->url() + "/shared.txt"), "backup");  // the backup wins
  EXPECT_EQ(read(live->url() + "/kept.txt"), "live");
  VSAErrorRef error;
  auto metadata = VSAMetadata::readAndValidateMetadataAtUrl(live->url(), user_, false,
                                                            *context_->globalConfiguration,
                                                            *context_->userIdentityCache, &error);
  ASSERT_TRUE(metadata) << error;
  EXPECT_EQ(metadata->uuid(), live->uuid());
  auto fresh = installer()->createOrLookupContainerWithContainerIdentity(
      identity("com.example.fresh", VSAClass::kSystemData), {}, &code);
  ASSERT_TRUE(fresh);
  EXPECT_EQ(read(fresh->url() + "/Library/prefs"), "fresh");
  EXPECT_TRUE(logged("Installing system containers"));
  EXPECT_FALSE(logged("Installing system group containers"));
  EXPECT_FALSE(fs::exists(perUser()->systemContainerBackupBaseDirectory()));

  // A restore a crash interrupted after the rename to .inprogress is resumed.
  std::string inProgress = library() + "/Data.inprogress";
  fs::create_directories(inProgress + "/com.example.sys");
  put(inProgress + "/com.example.sys/shared.txt", "resumed");
  rebootSetup();
  EXPECT_EQ(read(live->url() + "/shared.txt"), "resumed");
  EXPECT_TRUE(logged("Resuming the interrupted restore"));
  EXPECT_FALSE(fs::exists(perUser()->systemContainerBackupBaseDirectory()));
  EXPECT_FALSE(fs::exists(library()));

  // A backup that a user could have written is not restored.
  fs::create_directories(backup + "/com.example.sys");
  put(backup + "/com.example.sys/shared.txt", "planted");
  ASSERT_EQ(::chown(backup.c_str(), 501, 501), 0);
  rebootSetup();
  EXPECT_EQ(read(live->url() + "/shared.txt"), "resumed");
  EXPECT_TRUE(logged("Not restoring"));
}

TEST_F(Boot, InternalBuildsKeepARestoredBackupWithoutRestoringItAgain) {
  deviceFlags(VSAValue::Dictionary{{"HasInternalContent", VSAValue(true)}});
  std::string backup = perUser()->systemContainerBackupDirectory();
  fs::create_directories(backup + "/com.example.sys");
  put(backup + "/com.example.sys/shared.txt", "backup");
  rebootSetup();
  auto restored = lookup("com.example.sys", VSAClass::kSystemData);
  ASSERT_TRUE(restored);
  EXPECT_EQ(read(restored->url() + "/shared.txt"), "backup");
  EXPECT_TRUE(fs::is_directory(library() + "/Data.inprogress"));  // kept for inspection
  // Deleted afterwards, it stays deleted at the next boot.
  ASSERT_EQ(stage({identity("com.example.sys", VSAClass::kSystemData)}), VSAResult::kSuccess);
  rebootSetup();
  EXPECT_FALSE(lookup("com.example.sys", VSAClass::kSystemData));
  EXPECT_FALSE(logged("Resuming the interrupted restore"));
  // A new backup is restored as ever.
  fs::create_directories(backup + "/com.example.sys");
  put(backup + "/com.example.sys/shared.txt", "newer");
  rebootSetup();
  restored = lookup("com.example.sys", VSAClass::kSystemData);
  ASSERT_TRUE(restored);
  EXPECT_EQ(read(restored->url() + "/shared.txt"), "newer");
}

// Puts the user's own directory in the backup's place the moment the daemon
// moves the backup: what the user can do while the daemon is between
// checking the backup and moving it, made deterministic.
class BackupSwappingFileSystem : public VSAFaultInjectingFileSystem {
 public:
  using VSAFaultInjectingFileSystem::VSAFaultInjectingFileSystem;
  void arm(const std::string& backup, const std::string& planted) {
    backup_ = backup;
    planted_ = planted;
  }
  bool swapped() const { return swapped_; }
  int rename(const std::string& from, const std::string& to) override {
    swapIfBackup(from);
    return VSAFaultInjectingFileSystem::rename(from, to);
  }
  int renameWithoutSync(const std::string& from, const std::string& to) override {
    swapIfBackup(from);
    return VSAFaultInjectingFileSystem::renameWithoutSync(from, to);
  }
  int renameAt(int fromDir, const std::string& fromName, int toDir,
               const std::string& toName) override {
    if (!backup_.empty() && fromName == fs::path(backup_).filename().string())
      swapIfBackup(backup_);
    return VSAFaultInjectingFileSystem::renameAt(fromDir, fromName, toDir, toName);
  }

 private:
  void swapIfBackup(const std::string& from) {
    if (swapped_ || from != backup_) return;
    swapped_ = true;
    fs::rename(backup_, backup_ + ".genuine");
    fs::rename(planted_, backup_);
  }
  std::string backup_, planted_;
  bool swapped_ = false;
};

TEST_F(Boot, ABackupWhoseParentIsALinkBringsInNothingFromWhereItPoints) {
  VSAResultCode code;
  auto live = create(*installer(), "com.example.sys", &code, false, VSAClass::kSystemData);
  ASSERT_TRUE(live) << code;
  put(live->url() + "/shared.txt", "live");
  // The user turns the backup's parent into a link to a place holding a
  // root-owned directory of the backup's name.
  std::string backup = perUser()->systemContainerBackupDirectory();
  std::string parent = fs::path(backup).parent_path().string();
  std::string elsewhere = root_ + "/elsewhere";
  fs::create_directories(elsewhere + "/" + fs::path(backup).filename().string() +
                         "/com.example.sys");
  put(elsewhere + "/" + fs::path(backup).filename().string() + "/com.example.sys/shared.txt",
      "root's, elsewhere");
  fs::remove_all(parent);
  fs::create_directories(fs::path(parent).parent_path());
  fs::create_directory_symlink(elsewhere, parent);
  rebootSetup();
  EXPECT_EQ(read(live->url() + "/shared.txt"), "live");
  EXPECT_TRUE(fs::exists(elsewhere + "/" + fs::path(backup).filename().string() +
                         "/com.example.sys/shared.txt"))
      << "the directory the link points to stays where it is";
  EXPECT_FALSE(fs::exists(library() + "/Data.inprogress"));
}

TEST_F(Boot, ABackupSwappedBeforeItIsMovedIsNotRestoredAndRestoredItemsAreRoots) {
  VSAResultCode code;
  auto live = create(*installer(), "com.example.sys", &code, false, VSAClass::kSystemData);
  ASSERT_TRUE(live) << code;
  put(live->url() + "/shared.txt", "live");
  std::string backup = perUser()->systemContainerBackupDirectory();
  std::string planted = perUser()->systemContainerBackupBaseDirectory() + "/planted";
  fs::create_directories(backup + "/com.example.sys");
  put(backup + "/com.example.sys/shared.txt", "backup");
  fs::create_directories(planted + "/com.example.sys");
  put(planted + "/com.example.sys/shared.txt", "planted");
  for (const auto& p :
       {planted, planted + "/com.example.sys", planted + "/com.example.sys/shared.txt"})
    ASSERT_EQ(::chown(p.c_str(), 501, 501), 0);
  std::shared_ptr<BackupSwappingFileSystem> swapper;
  context_.reset();
  context_ = std::make_unique<VSADaemonContext>(
      VSASystemRoot(root_), [&](std::shared_ptr<VSAFileSystem> real) {
        swapper = std::make_shared<BackupSwappingFileSystem>(std::move(real));
        faults_ = swapper;
        return swapper;
      });
  user_ = context_->userIdentityCache->userIdentityForPersonalPersona();
  swapper->arm(backup, planted);
  rebootSetup();
  EXPECT_TRUE(swapper->swapped());
  EXPECT_EQ(read(live->url() + "/shared.txt"), "live");
  EXPECT_TRUE(logged("Not restoring"));
  EXPECT_FALSE(fs::exists(library() + "/Data.inprogress"));

  // A root-owned backup is restored, and what it holds becomes root's
  // before it enters the live container.
  fs::create_directories(backup + "/com.example.sys/Library/Mine");
  put(backup + "/com.example.sys/Library/Mine/file", "user's");
  for (const char* p : {"/Library/Mine", "/Library/Mine/file"})
    ASSERT_EQ(::chown((backup + "/com.example.sys" + p).c_str(), 501, 501), 0);
  rebootSetup();
  EXPECT_EQ(read(live->url() + "/Library/Mine/file"), "user's");
  for (const char* p : {"/Library/Mine", "/Library/Mine/file"}) {
    struct stat st {};
    ASSERT_EQ(::lstat((live->url() + p).c_str(), &st), 0);
    EXPECT_NE(st.st_uid, 501u) << p;
  }
}

TEST_F(Boot, OnlyEntriesThatAreNotLiveContainersAreCleanedAway) {
  VSAResultCode code;
  auto live = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(live) << code;
  std::string dir = classDirectory(VSAClass::kDataApplication);
  std::string noMetadata = dir + "/" + VSAUUID::random().string();
  fs::create_directories(noMetadata + "/Documents");
  put(noMetadata + "/Documents/left", "x");
  fs::create_directories(dir + "/not-a-container");
  put(dir + "/not-a-container/file", "x");
  // A class directory that is not there says nothing.
  fs::remove_all(classDirectory(VSAClass::kDataPlugin));

  rebootCleanup();
  EXPECT_TRUE(fs::is_directory(live->url()));
  EXPECT_FALSE(fs::exists(noMetadata));
  EXPECT_FALSE(fs::exists(dir + "/not-a-container"));
  EXPECT_TRUE(logged("Deleting orphaned data missing a metadata file at: " + noMetadata));
  EXPECT_FALSE(logged("metadata file at: " + dir + "/not-a-container"));
  EXPECT_FALSE(logged("Failed to get items"));
  EXPECT_FALSE(logged("INTERNAL BUILD REQUEST"));

  // Internal builds describe what they remove.
  deviceFlags(VSAValue::Dictionary{{"HasInternalContent", VSAValue(true)}});
  fs::create_directories(dir + "/stray/deep");
  rebootCleanup();
  EXPECT_FALSE(fs::exists(dir + "/stray"));
  EXPECT_TRUE(logged("***INTERNAL BUILD REQUEST"));
  EXPECT_TRUE(logged("Someone is writing invalid data to a container"));
  EXPECT_TRUE(logged("***END INTERNAL BUILD REQUEST"));
}

// The scan runs while requests are served. A wipe leaves its container's
// path empty between its two renames (held there by test lock 3): the scan
// finds no metadata file in that moment, and the wipe finishes before the
// scan looks again. The fresh container must stay.
TEST_F(Boot, TheOrphanScanLeavesAloneAContainerThatAWipeIsReplacing) {
  VSAResultCode code;
  auto live = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(live) << code;
  put(live->url() + "/Documents/old", "x");
  auto& locks = *context_->testLocks;
  struct Off {
    VSATestLocks& locks;
    ~Off() { locks.setEnabled(false); }
  } off{locks};
  locks.setEnabled(true);
  locks.acquireLock(kVSATestLockReplace);
  std::promise<VSAResultCode> wiped;
  auto result = wiped.get_future();
  std::thread wiper([&] {
    VSAResultCode c = VSAResult::kSuccess;
    installer()->deleteDataContainerContentWithContainerIdentity(identity("com.example.app"), &c);
    wiped.set_value(c);
  });
  for (int i = 0; i < 1000 && fs::exists(live->url()); ++i) std::this_thread::sleep_for(10ms);
  bool halfway = !fs::exists(live->url());
  faults_->afterNextLstatOf(live->url() + "/" + kVSAMetadataFileName, [&] {
    locks.releaseLock(kVSATestLockReplace);
    result.wait();
  });
  if (halfway)
    keeper()._cleanupOrphanedDataForDirectories({live->url()}, VSAClass::kDataApplication);
  if (!halfway) locks.releaseLock(kVSATestLockReplace);
  wiper.join();
  ASSERT_TRUE(halfway) << "the wipe never moved the old container aside";
  EXPECT_EQ(result.get(), VSAResult::kSuccess);
  EXPECT_TRUE(fs::exists(live->url() + "/" + kVSAMetadataFileName));
  EXPECT_FALSE(fs::exists(live->url() + "/Documents/old"));
  EXPECT_FALSE(logged("Deleting orphaned data missing a metadata file at: " + live->url()));
  auto found = lookup("com.example.app");
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), live->url());
}

TEST_F(Boot, AnUpgradeRenamesSystemContainersExceptWellKnownAndAnalytics) {
  VSAResultCode code;
  auto plain = create(*installer(), "com.example.sys", &code, false, VSAClass::kSystemData);
  auto wellKnown =
      create(*installer(), "systemgroup.com.tamsk.launcher", &code, false, VSAClass::kSystemGroup);
  auto analytics = create(*installer(), kVSAAnalyticsSystemGroupIdentifier, &code, false,
                          VSAClass::kSystemGroup);
  ASSERT_TRUE(plain && wellKnown && analytics) << code;
  VSAOldDevice::writeSystemVersion(root_, "B1");
  installer()->rebootKeeperSetup();  // records B1
  VSAOldDevice::writeSystemVersion(root_, "B2");
  installer()->rebootKeeperSetup();
  EXPECT_TRUE(logged("Rolling system container directory UUIDs on disk"));
  auto find = [&](const char* id, VSAContainerClass c) {
    return installer()->createOrLookupContainerWithContainerIdentity(identity(id, c), {}, &code);
  };
  auto moved = find("com.example.sys", VSAClass::kSystemData);
  ASSERT_TRUE(moved);
  EXPECT_NE(moved->url(), plain->url());
  EXPECT_EQ(moved->uuid(), plain->uuid());
  EXPECT_EQ(find("systemgroup.com.tamsk.launcher", VSAClass::kSystemGroup)->url(),
            wellKnown->url());
  EXPECT_EQ(find(kVSAAnalyticsSystemGroupIdentifier, VSAClass::kSystemGroup)->url(),
            analytics->url());
  installer()->rebootKeeperSetup();  // same build: nothing moves
  EXPECT_EQ(find("com.example.sys", VSAClass::kSystemData)->url(), moved->url());
}

TEST_F(Boot, AnUpgradeOfADeviceWithoutSystemContainersRecordsTheACLMigration) {
  auto systemBase = [&](VSAContainerClass c) {
    return *context_->globalConfiguration->globalContainerBaseURLWithContentClass(c, false);
  };
  ASSERT_FALSE(fs::exists(systemBase(VSAClass::kSystemData)));
  ASSERT_FALSE(fs::exists(systemBase(VSAClass::kSystemGroup)));
  VSAOldDevice::writeSystemVersion(root_, "B1");
  installer()->rebootKeeperSetup();
  EXPECT_TRUE(logged("No system containers requiring ACL migration"));
  auto status = VSAMigrationStatus::initForSystemMigration(
      *context_->globalConfiguration, root_ + "/etc/vessad/system-version.plist");
  ASSERT_TRUE(status);
  EXPECT_TRUE(status->hasMigrationOccurredForType("ACLMigration"));
  EXPECT_FALSE(status->isBuildUpgrade());
}

TEST_F(Boot, GroupsAreReconciledAtBootOnlyInMultiUserMode) {
  VSAResultCode code;
  auto group = create(*installer(), "group.com.example.nobody", &code, false, VSAClass::kAppGroup);
  ASSERT_TRUE(group) << code;
  rebootSetup();
  EXPECT_TRUE(fs::is_directory(group->url()));  // no flags: left alone
  deviceFlags(VSAValue::Dictionary{{"MultiUserFlags", VSAValue(uint64_t{0x7fffffff})}});
  rebootSetup();
  EXPECT_TRUE(fs::is_directory(group->url()));  // top bit clear
  deviceFlags(VSAValue::Dictionary{{"MultiUserFlags", VSAValue(uint64_t{0x80000000u})}});
  rebootSetup();
  EXPECT_FALSE(fs::exists(group->url()));  // no identifier references it
}

}  // namespace
