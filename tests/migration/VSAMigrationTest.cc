// Upgrades: the migration status file, the legacy code-signing pass (also
// interrupted after each of its file-system steps), and the container
// migrator's build-upgrade (which leaves what the user planted in the old
// bundle location) and client-requested migrations.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "VSAContainerTestRoot.h"
#include "VSAOldDevice.h"
#include "VSATestDatabaseFaults.h"
#include "VSATestLog.h"
#include "codesigning/VSACodeSigningMigration.h"
#include "daemon/VSARootChecker.h"
#include "migration/VSAContainerMigrator.h"
#include "migration/VSAMigrationStatus.h"

namespace fs = std::filesystem;

namespace {

class Migration : public VSAContainerTestRoot {
 protected:
  std::string versionPath() { return root_ + "/etc/vessad/system-version.plist"; }
  std::string library() { return context_->globalConfiguration->libraryDirectory(); }
  std::unique_ptr<VSAMigrationStatus> status() {
    return VSAMigrationStatus::initForSystemMigration(*context_->globalConfiguration,
                                                      versionPath());
  }
  bool codeSigningPass() {
    VSACommandQueue queue;
    bool ok = context_->containerMigrator->performDataMigratorMigrationForClientConnection(
        VSAMigrationClient{}, queue, nullptr);
    VSAResultCode code = VSAResult::kSuccess;
    bool executed = queue.executeAllUntilExhaustedOrError(&code);
    EXPECT_EQ(executed, code == VSAResult::kSuccess) << code;
    return ok;
  }
  std::optional<VSACodeSigningEntry> entry(const std::string& id) {
    return context_->codeSigningMapping->codeSigningEntryForIdentifier(id, nullptr);
  }
  std::optional<VSAValue> info(const std::string& id, VSAContainerClass c, const char* key) {
    VSAResultCode code = VSAResult::kSuccess;
    VSAValue k(key);
    return installer()->infoValueForKey(&k, identity(id, c), true, &code);
  }
  void registerKept() {
    VSACommandQueue queue;
    std::string id = VSAOldDevice::kKept;
    VSAValue info = VSAValue::Dictionary{
        {kVSAEntitlementsKey, VSAValue::Dictionary{{"current", VSAValue(true)}}}};
    ASSERT_EQ(context_->codeSigningMapping->processCodeSigningInfo(info, &id,
                                                                   VSAValue::dictionary(), &queue),
              VSAResult::kSuccess);
  }
  // A copy of a device keeps owners, modes and ACLs, as the checker judges them.
  static void copyPreservingOwners(const fs::path& from, const fs::path& to) {
    ASSERT_EQ(std::system(("cp -a '" + from.string() + "' '" + to.string() + "'").c_str()), 0);
  }
  // Runs `migrate` on the root as it is now, then again for every crash
  // point on a fresh copy of it: stopped after the n-th file-system call, a
  // restart, `wasInterrupted` asked, and `migrate` once more, which must
  // succeed and leave what `expectDone` checks, on a root the checker finds
  // in order. Returns (points, interrupted).
  template <typename Migrate, typename Interrupted, typename Done>
  std::pair<int, int> crashSweep(Migrate migrate, Interrupted wasInterrupted, Done expectDone) {
    fs::path snapshot = fs::path(root_ + ".snapshot");
    copyPreservingOwners(root_, snapshot);
    startContext();
    faults_->reset();
    EXPECT_TRUE(migrate());
    int total = faults_->totalCalls(), interrupted = 0;
    for (int n = 1; n <= total; ++n) {
      SCOPED_TRACE("crash after call " + std::to_string(n));
      context_.reset();
      fs::remove_all(root_);
      copyPreservingOwners(snapshot, root_);
      startContext();
      faults_->crashAfter(n);
      migrate();
      restart();
      if (wasInterrupted()) ++interrupted;
      EXPECT_TRUE(migrate());
      expectDone();
      // The old device's stand-in bundle (OLD-APP) has no metadata file, so
      // after its move the checker rightly calls it an orphan; nothing else
      // may be found.
      VSARootChecker checker(root_);
      EXPECT_NE(checker.check(), VSARootChecker::kUnreadable) << checker.unreadableReason();
      for (const auto& f : checker.findings())
        EXPECT_TRUE(f.kind == "orphan" && fs::path(f.path).filename() == "OLD-APP")
            << checker.text();
      if (HasFailure()) break;
    }
    fs::remove_all(snapshot);
    return {total, interrupted};
  }
  // A well-known system group container that an old release kept under a
  // UUID name: the container and the name it has now.
  std::pair<VSAMetadataRef, std::string> hideWellKnownUnderUUID() {
    VSAResultCode code;
    auto wellKnown = create(*installer(), "systemgroup.com.tamsk.launcher", &code, false,
                            VSAClass::kSystemGroup);
    if (!wellKnown) return {nullptr, ""};
    std::string uuidPath = fs::path(wellKnown->url()).parent_path() / VSAUUID::random().string();
    fs::rename(wellKnown->url(), uuidPath);
    return {wellKnown, uuidPath};
  }
  // What an uninterrupted upgrade leaves: every legacy identifier in the
  // database as described, legacy values and files gone, markers set.
  void expectMigrated() {
    auto cached = entry(VSAOldDevice::kCached);
    ASSERT_TRUE(cached);
    EXPECT_FALSE(cached->isInvalid());
    EXPECT_EQ(cached->dataContainerClass(), VSAClass::kDataApplication);
    EXPECT_TRUE(cached->codeSigningInfo().get(kVSAEntitlementsKey));
    EXPECT_FALSE(cached->codeSigningInfo().get("Entitlements"));
    auto grouped = entry(VSAOldDevice::kGrouped);
    ASSERT_TRUE(grouped);
    EXPECT_TRUE(grouped->isInvalid());
    auto legacy = entry(VSAOldDevice::kLegacy);
    ASSERT_TRUE(legacy);
    ASSERT_TRUE(legacy->childBundleIdentifiers());
    EXPECT_EQ(legacy->childBundleIdentifiers()->front(), "com.example.legacy.widget");
    auto placeholder = entry(VSAOldDevice::kPlaceholder);
    ASSERT_TRUE(placeholder);
    EXPECT_TRUE(placeholder->isPlaceholder());
    auto kept = entry(VSAOldDevice::kKept);
    ASSERT_TRUE(kept);
    EXPECT_TRUE(kept->codeSigningInfo().get(kVSAEntitlementsKey)->get("current"));
    EXPECT_FALSE(
        info(VSAOldDevice::kCached, VSAClass::kBundleApplication, kVSACachedCodeSigningInfoKey));
    EXPECT_FALSE(
        info(VSAOldDevice::kGrouped, VSAClass::kDataApplication, kVSAGroupContainerIDsKey));
    EXPECT_FALSE(fs::exists(library() + "/vsa_entitlements.plist"));
    auto s = status();
    ASSERT_TRUE(s);
    for (const char* type :
         {"CodeSigningMigration", "GroupIdMigration", "BundleMigration", "ACLMigration"})
      EXPECT_TRUE(s->hasMigrationOccurredForType(type)) << type;
    // Every container keeps its files; the group stays referenced.
    for (auto [id, c] : std::vector<std::pair<const char*, VSAContainerClass>>{
             {VSAOldDevice::kCached, VSAClass::kBundleApplication},
             {VSAOldDevice::kGrouped, VSAClass::kDataApplication},
             {VSAOldDevice::kGroup, VSAClass::kAppGroup}}) {
      VSAResultCode code = VSAResult::kSuccess;
      auto m =
          installer()->createOrLookupContainerWithContainerIdentity(identity(id, c), {}, &code);
      ASSERT_TRUE(m) << id;
      EXPECT_TRUE(fs::exists(m->url() + "/keep.txt")) << id;
    }
  }
};

TEST_F(Migration, TheStatusFileRecordsBuildsAndTypesAndConvertsMarkersOnce) {
  // Fresh install: empty status written at once, every doubt is an upgrade.
  auto fresh = status();
  ASSERT_TRUE(fresh);
  EXPECT_TRUE(fresh->isBuildUpgrade());
  EXPECT_EQ(fresh->currentBuildVersion(), "Unknown");
  EXPECT_TRUE(fs::exists(library() + "/vsa_migration_status.plist"));
  ASSERT_TRUE(fresh->writeCurrentBuildInfoToDisk());
  EXPECT_TRUE(status()->isBuildUpgrade());  // still no build to compare

  VSAOldDevice::writeSystemVersion(root_, "B100", "User");
  ASSERT_TRUE(status()->writeCurrentBuildInfoToDisk());
  VSAOldDevice::writeSystemVersion(root_, "B100", "Internal");
  EXPECT_FALSE(status()->isBuildUpgrade());  // same build, other release type
  VSAOldDevice::writeSystemVersion(root_, "B200", "User");
  auto upgraded = status();
  EXPECT_TRUE(upgraded->isBuildUpgrade());
  EXPECT_FALSE(upgraded->hasMigrationOccurredForType("ACLMigration"));
  ASSERT_TRUE(upgraded->setMigrationCompleteForType("ACLMigration"));
  EXPECT_TRUE(status()->hasMigrationOccurredForType("ACLMigration"));

  // A corrupt file fails creation; nothing runs on it.
  std::ofstream(library() + "/vsa_migration_status.plist") << "not a plist";
  EXPECT_FALSE(status());
  // Markers become types, and go only once the combined file was written.
  fs::remove(library() + "/vsa_migration_status.plist");
  std::string marker = library() + "/vsa_acl2_migration_complete.plist";
  VSA_writeToURL(VSAValue::Dictionary{{"VSAMigrationVersionNumber", VSAValue("A1")}}, marker, 0,
                 nullptr);
  faults_->failAll(VSAFileSystem::Op::Rename, EIO);
  auto unsaved = status();
  ASSERT_TRUE(unsaved);
  EXPECT_TRUE(fs::exists(marker));
  faults_->reset();
  auto converted = status();
  ASSERT_TRUE(converted);
  EXPECT_TRUE(converted->hasMigrationOccurredForType("ACLMigration"));
  EXPECT_FALSE(converted->hasMigrationOccurredForType("BundleMigration"));
  EXPECT_FALSE(fs::exists(marker));
  auto user = VSAMigrationStatus::initForMobileUserMigration(
      *context_->globalConfiguration, *context_->userIdentityCache, versionPath());
  ASSERT_TRUE(user);
  EXPECT_NE(user->migrationFileURL(), converted->migrationFileURL());
}

TEST_F(Migration, TheCodeSigningPassMovesEveryLegacySourceOnceAndKeepsValidEntries) {
  VSAOldDevice::build(*context_, *installer(), user_);
  registerKept();
  ASSERT_TRUE(codeSigningPass());
  expectMigrated();
  // A second run finds nothing to do and changes nothing.
  auto before = entry(VSAOldDevice::kGrouped);
  ASSERT_TRUE(codeSigningPass());
  EXPECT_TRUE(entry(VSAOldDevice::kGrouped)->isEqual(*before));
  expectMigrated();
}

TEST_F(Migration, EachMigratedIdentifierIsAnnouncedBeforeItsDatabaseWrite) {
  VSAOldDevice::build(*context_, *installer(), user_);
  std::string database = library() + "/containers.sqlite3";
  context_.reset();
  ASSERT_EQ(
      VSARefuseEntryWritesAt(
          database, {VSAOldDevice::kGrouped, VSAOldDevice::kLegacy, VSAOldDevice::kCached}, true),
      "");
  startContext();
  VSATestLog log;
  ASSERT_TRUE(log.open(root_ + "/test.log"));
  EXPECT_FALSE(codeSigningPass());
  // Every write is refused; the line that says what is being migrated came first.
  for (auto [announcement, failure] : std::vector<std::pair<std::string, std::string>>{
           {"Migrating app group entitlements for com.example.grouped",
            "Failed to write migrated group id info to DB for com.example.grouped"},
           {"Migrating legacy entitlements for com.example.legacy",
            "Failed to write migrated legacy info to DB for com.example.legacy"},
           {"Migrating code signing info for com.example.cached",
            "Failed to write migrated cached cs info from bundle container to DB for "
            "com.example.cached"}}) {
    size_t announced = log.position(announcement), refused = log.position(failure);
    ASSERT_NE(refused, std::string::npos) << failure;
    ASSERT_NE(announced, std::string::npos) << announcement;
    EXPECT_LT(announced, refused) << announcement;
  }
  // Nothing was lost: every source stays for the next pass.
  EXPECT_FALSE(entry(VSAOldDevice::kLegacy));
  EXPECT_TRUE(fs::exists(library() + "/vsa_entitlements.plist"));
  EXPECT_TRUE(
      info(VSAOldDevice::kCached, VSAClass::kBundleApplication, kVSACachedCodeSigningInfoKey));
  EXPECT_TRUE(info(VSAOldDevice::kGrouped, VSAClass::kDataApplication, kVSAGroupContainerIDsKey));
}

TEST_F(Migration, ClearingFailuresCarryTheirOwnResultCodeAndOddCachedValuesAreCleared) {
  VSAOldDevice::build(*context_, *installer(), user_);
  VSAResultCode code = VSAResult::kSuccess;
  auto odd = create(*installer(), "com.example.odd", &code, false, VSAClass::kBundleApplication);
  ASSERT_TRUE(odd) << code;
  VSAValue notADictionary("not a dictionary");
  VSAValue key(kVSACachedCodeSigningInfoKey);
  ASSERT_TRUE(installer()->setInfoValue(&notADictionary, &key,
                                        identity("com.example.odd", VSAClass::kBundleApplication),
                                        true, &code))
      << code;
  // Two containers whose metadata file goes bad behind the cache's back.
  auto cached = lookup(VSAOldDevice::kCached, VSAClass::kBundleApplication);
  auto grouped = lookup(VSAOldDevice::kGrouped, VSAClass::kDataApplication);
  ASSERT_TRUE(cached && grouped);
  for (const auto& m : {cached, grouped})
    put(m->url() + "/" + kVSAMetadataFileName, "not a property list");
  code = VSAResult::kSuccess;
  VSAValue anyKey("any");
  EXPECT_FALSE(installer()->infoValueForKey(
      &anyKey, identity(VSAOldDevice::kCached, VSAClass::kBundleApplication), true, &code));
  VSAResultCode unreadable = code;  // what reading that metadata answers
  ASSERT_NE(unreadable, VSAResult::kSuccess);
  ASSERT_NE(unreadable, VSAResult::kWriteFailed);
  VSATestLog log;
  ASSERT_TRUE(log.open(root_ + "/test.log"));
  EXPECT_FALSE(codeSigningPass());
  std::string u = std::to_string(unreadable);
  EXPECT_TRUE(log.contains("Failed to clear group id metadata for com.example.grouped : " + u))
      << log.text();
  EXPECT_TRUE(log.contains("Error setting info value for identity " +
                           cached->containerIdentity()->description() + " : " + u));
  // The value that was no dictionary left no entry and is gone.
  EXPECT_FALSE(entry("com.example.odd"));
  EXPECT_FALSE(info("com.example.odd", VSAClass::kBundleApplication, kVSACachedCodeSigningInfoKey));
}

TEST_F(Migration, TheDataMigrationAnswersTheCodeOfTheStepThatFailed) {
  VSAResultCode code = VSAResult::kSuccess;
  ASSERT_TRUE(create(*installer(), "com.example.sys", &code, false, VSAClass::kSystemData)) << code;
  // Without the "systemusers" group no system container ACL can be made;
  // the bundle ownership step after it still succeeds.
  std::ofstream(root_ + "/etc/group") << "mobile:x:501:\n";
  startContext();
  VSACommandQueue queue;
  code = VSAResult::kSuccess;
  EXPECT_FALSE(context_->containerMigrator->performDataMigratorMigrationForClientConnection(
      VSAMigrationClient{}, queue, &code));
  EXPECT_EQ(code, VSAResult::kACLFailed);
  EXPECT_FALSE(status()->hasMigrationOccurredForType("ACLMigration"));
  EXPECT_TRUE(status()->hasMigrationOccurredForType("BundleMigration"));
}

TEST_F(Migration, MultiUserModeSkipsTheGroupIdMigrationAndReconciliation) {
  fs::create_directories(root_ + "/etc/vessad");
  VSA_writeToURL(VSAValue::Dictionary{{"MultiUserFlags", VSAValue(uint64_t{0x80000000u})}},
                 root_ + "/etc/vessad/device.plist", 0, nullptr);
  startContext();
  VSAOldDevice::build(*context_, *installer(), user_);
  ASSERT_TRUE(codeSigningPass());
  EXPECT_FALSE(entry(VSAOldDevice::kGrouped));
  EXPECT_TRUE(info(VSAOldDevice::kGrouped, VSAClass::kDataApplication, kVSAGroupContainerIDsKey));
  EXPECT_FALSE(status()->hasMigrationOccurredForType("GroupIdMigration"));
  EXPECT_TRUE(status()->hasMigrationOccurredForType("CodeSigningMigration"));
  EXPECT_TRUE(entry(VSAOldDevice::kLegacy));
}

TEST_F(Migration, AnInterruptedPassEndsLikeAnUninterruptedOneWhenRunAgain) {
  VSAOldDevice::build(*context_, *installer(), user_);
  registerKept();
  auto [total, interrupted] =
      crashSweep([&] { return codeSigningPass(); },
                 [&] {
                   auto after = status();
                   return !after || !after->hasMigrationOccurredForType("CodeSigningMigration") ||
                          fs::exists(library() + "/vsa_entitlements.plist");
                 },
                 [&] { expectMigrated(); });
  ASSERT_GT(total, 10);
  std::printf(
      "code-signing migration crash sweep: %d crash points (%d left it half done), all "
      "clean after the next run\n",
      total, interrupted);
  EXPECT_GT(interrupted, total / 2);
}

TEST_F(Migration, TheBuildUpgradeMovesLogsBundlesAndWellKnownSystemContainers) {
  VSAOldDevice::build(*context_, *installer(), user_);
  VSAResultCode code;
  auto hidden = hideWellKnownUnderUUID();
  VSAMetadataRef wellKnown = hidden.first;
  std::string uuidPath = hidden.second;
  ASSERT_TRUE(wellKnown);
  startContext();
  VSAOldDevice::writeSystemVersion(root_, "NEW2");
  auto s = status();
  ASSERT_TRUE(s && s->isBuildUpgrade());
  VSAErrorRef error;
  ASSERT_TRUE(context_->containerMigrator->performSynchronousBuildUpgradeMigration(*s, &error))
      << error;
  std::string logs = context_->globalConfiguration->logDirectory();
  EXPECT_TRUE(fs::exists(logs + "/vessad.0"));
  EXPECT_TRUE(fs::exists(logs + "/vessad.1"));
  EXPECT_FALSE(fs::exists(logs + "/vessad.7"));  // beyond the writer's three files
  EXPECT_FALSE(fs::exists(root_ + "/private/var/mobile/Library/Logs/Vessa"));
  std::string bundles = context_->globalConfiguration->bundleDirectory();
  EXPECT_TRUE(fs::exists(bundles + "/Application/OLD-APP/Info.plist"));
  EXPECT_FALSE(fs::exists(root_ + "/private/var/mobile/Containers/Bundle"));
  // No system container directories existed: ACLs need nothing.
  EXPECT_FALSE(s->hasMigrationOccurredForType("ACLMigration"));  // a system group exists
  EXPECT_TRUE(fs::is_directory(wellKnown->url()));
  EXPECT_FALSE(fs::exists(uuidPath));
  auto found = installer()->createOrLookupContainerWithContainerIdentity(
      identity("systemgroup.com.tamsk.launcher", VSAClass::kSystemGroup), {}, &code);
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), wellKnown->url());
  EXPECT_EQ(found->uuid(), wellKnown->uuid());
  ASSERT_TRUE(s->writeCurrentBuildInfoToDisk());
  EXPECT_FALSE(status()->isBuildUpgrade());
  // A second run with nothing left to move succeeds quietly.
  EXPECT_TRUE(context_->containerMigrator->performSynchronousBuildUpgradeMigration(*s, &error));
  // Without any system container directory the ACL migration is recorded untouched.
  for (VSAContainerClass c : {VSAClass::kSystemData, VSAClass::kSystemGroup})
    fs::remove_all(
        *context_->globalConfiguration->globalContainerBaseURLWithContentClass(c, false));
  startContext();
  auto bare = status();
  ASSERT_TRUE(context_->containerMigrator->performSynchronousBuildUpgradeMigration(*bare, &error));
  EXPECT_TRUE(bare->hasMigrationOccurredForType("ACLMigration"));
}

TEST_F(Migration, TheBuildUpgradeMovesOnlyWhatTheInstallationLeftInTheOldBundleLocation) {
  std::string old = root_ + "/private/var/mobile/Containers/Bundle/Application";
  // A bundle container of the old release, with its metadata file.
  auto container = [&](const std::string& id, uid_t owner, const std::string& in) {
    std::string dir = in + "/" + VSAUUID::random().string();
    fs::create_directories(dir);
    VSAMetadata m(VSAConcreteContainerIdentity::containerIdentityWithUUID(
                      VSAUUID::random(), context_->userIdentityCache->defaultUserIdentity(), id,
                      VSAClass::kBundleApplication, nullptr),
                  std::nullopt, dir, std::nullopt);
    EXPECT_TRUE(m.writeMetadataToDiskWithError(*context_->globalConfiguration, nullptr));
    EXPECT_EQ(::chown(dir.c_str(), owner, owner), 0);
    EXPECT_EQ(::chown((dir + "/" + kVSAMetadataFileName).c_str(), owner, owner), 0);
    return dir;
  };
  std::string genuine = container("com.example.genuine", 0, old);
  // What the mobile user can put there: its own directory with a forged
  // metadata file, a directory that anyone may write, a root-owned
  // directory holding the user's metadata file, a link to a container.
  std::vector<std::string> planted = {
      container("com.example.victim", 501, old), container("com.example.open", 0, old),
      container("com.example.mixed", 0, old), old + "/" + VSAUUID::random().string()};
  fs::permissions(planted[1], fs::perms::all);
  ASSERT_EQ(::chown((planted[2] + "/" + kVSAMetadataFileName).c_str(), 501, 501), 0);
  fs::create_directory_symlink(container("com.example.linked", 0, root_ + "/private/var/elsewhere"),
                               planted[3]);
  startContext();
  VSAOldDevice::writeSystemVersion(root_, "NEW2");
  auto s = status();
  VSAErrorRef error;
  ASSERT_TRUE(context_->containerMigrator->performSynchronousBuildUpgradeMigration(*s, &error))
      << error;
  std::string bundles = context_->globalConfiguration->bundleDirectory() + "/Application";
  std::string moved = bundles + "/" + fs::path(genuine).filename().string();
  EXPECT_TRUE(fs::exists(moved + "/" + kVSAMetadataFileName));
  auto found = lookup("com.example.genuine", VSAClass::kBundleApplication);
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), moved);
  for (const auto& dir : planted) {
    SCOPED_TRACE(dir);
    EXPECT_FALSE(fs::exists(bundles + "/" + fs::path(dir).filename().string()));
    EXPECT_TRUE(fs::exists(fs::symlink_status(dir)));
  }
  for (const char* id :
       {"com.example.victim", "com.example.open", "com.example.mixed", "com.example.linked"})
    EXPECT_FALSE(lookup(id, VSAClass::kBundleApplication)) << id;
}

TEST_F(Migration, PerUserMigrationRestoresStructureOnceAndRemovesDeprecatedContainers) {
  VSAResultCode code;
  auto app = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(app) << code;
  auto retired = create(*installer(), "com.example.retired", &code);
  ASSERT_TRUE(retired) << code;
  fs::create_directories(root_ + "/etc/vessad");
  VSA_writeToURL(VSAValue::Dictionary{{"unused", VSAValue(true)}},
                 root_ + "/etc/vessad/deprecated-containers.plist", 0, nullptr);  // not a list
  VSAValue list = VSAValue::Array{
      VSAValue(VSAValue::Dictionary{{"Identifier", VSAValue("com.example.retired")},
                                    {"ContainerClass", VSAValue(VSAClass::kDataApplication)}}),
      VSAValue(VSAValue::Dictionary{{"Identifier", VSAValue(uint64_t{7})}})};  // logged, skipped
  fs::remove_all(app->url() + "/Documents");
  auto run = [&] {
    auto c = installer();
    VSAResultCode result = VSAResult::kSuccess;
    c->performPerUserDataMigrationForClientConnection(&result);
    c->completeWithError(&result);
    return result;
  };
  EXPECT_EQ(run(), VSAResult::kSuccess);  // the bad list removes nothing
  EXPECT_TRUE(fs::is_directory(app->url() + "/Documents"));
  EXPECT_TRUE(fs::exists(retired->url()));
  auto mobile = VSAMigrationStatus::initForMobileUserMigration(
      *context_->globalConfiguration, *context_->userIdentityCache, versionPath());
  EXPECT_TRUE(mobile->hasMigrationOccurredForType("SubdirectoryMigration"));

  ASSERT_TRUE(VSA_writeToURL(list, root_ + "/etc/vessad/deprecated-containers.plist", 0, nullptr));
  fs::remove_all(app->url() + "/Documents");
  EXPECT_EQ(run(), VSAResult::kSuccess);
  EXPECT_FALSE(fs::exists(app->url() + "/Documents"));  // recorded: not again
  EXPECT_FALSE(fs::exists(retired->url()));
  EXPECT_EQ(run(), VSAResult::kSuccess);  // already gone: nothing to do
}

TEST_F(Migration, AnInterruptedBuildUpgradeEndsLikeAnUninterruptedOneWhenRunAgain) {
  VSAOldDevice::build(*context_, *installer(), user_);
  VSAResultCode code;
  auto hidden = hideWellKnownUnderUUID();
  VSAMetadataRef wellKnown = hidden.first;
  std::string uuidPath = hidden.second;
  ASSERT_TRUE(wellKnown);
  VSAOldDevice::writeSystemVersion(root_, "NEW2");
  auto upgrade = [&] {
    auto s = status();
    VSAErrorRef error;
    return s && context_->containerMigrator->performSynchronousBuildUpgradeMigration(*s, &error);
  };
  std::string logs = root_ + "/private/var/root/Library/Logs/Vessa";
  std::string bundles = root_ + "/private/var/containers/Bundle";
  auto [total, interrupted] = crashSweep(
      upgrade,
      [&] {
        return fs::exists(root_ + "/private/var/mobile/Containers/Bundle") || fs::exists(uuidPath);
      },
      [&] {
        EXPECT_TRUE(fs::exists(logs + "/vessad.0"));
        EXPECT_TRUE(fs::exists(logs + "/vessad.1"));
        EXPECT_TRUE(std::ifstream(bundles + "/Application/OLD-APP/Info.plist").good());
        EXPECT_FALSE(fs::exists(root_ + "/private/var/mobile/Containers/Bundle"));
        EXPECT_TRUE(fs::is_directory(wellKnown->url()));
        EXPECT_FALSE(fs::exists(uuidPath));
        auto found = installer()->createOrLookupContainerWithContainerIdentity(
            identity("systemgroup.com.tamsk.launcher", VSAClass::kSystemGroup), {}, &code);
        ASSERT_TRUE(found);
        EXPECT_EQ(found->uuid(), wellKnown->uuid());
      });
  ASSERT_GT(total, 5);
  std::printf("build-upgrade crash sweep: %d crash points (%d interrupted a move), all clean\n",
              total, interrupted);
  EXPECT_GT(interrupted, 0);
}

}  // namespace
