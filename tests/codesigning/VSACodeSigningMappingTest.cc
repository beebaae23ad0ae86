#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "VSAFakeCodeSigning.h"
#include "VSATestTempDir.h"
#include "base/VSAPlist.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "model/FakePersonaService.h"
#include "model/VSAContainerCache.h"
#include "operations/VSACommandStageForDelete.h"
#include "platform/VSALinuxFileSystem.h"

namespace fs = std::filesystem;

namespace {

class Mapping : public ::testing::Test {
 protected:
  void SetUp() override { build(nullptr); }

  // Builds the mapping; `legacy` is written as the old mapping file first.
  void build(const VSAValue* legacy) {
    root_ = temp_.path();
    VSAWriteMobileUser(root_);
    VSASystemRoot root(root_);
    auto users = std::make_shared<VSAUserDatabase>(root);
    auto config = std::make_shared<VSAGlobalConfiguration>(
        root, std::make_shared<VSADeviceProperties>(root), users,
        std::make_shared<VSAFileManager>(std::make_shared<VSALinuxFileSystem>(), users));
    auto personas = std::make_shared<FakePersonaService>();
    personas->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(VSAPersonaAttributes::Kind::Personal, 1000, "P")};
    auto cache = VSAUserIdentityCache::create({personas, users, 501, 501, true, nullptr});
    legacyPath_ = config->libraryDirectory() + "/vsa_code_signing_info.plist";
    if (legacy) VSA_writeToURL(*legacy, legacyPath_, 0, nullptr);
    mapping_.reset();
    mapping_ = std::make_unique<VSACodeSigningMapping>(
        cache, config, std::make_unique<VSASQLiteDB>(config->libraryDirectory()), locks_);
    config_ = config;
    personal_ = cache->userIdentityForPersonalPersona();
    containers_ = VSAContainerCache::create(
        {cache, config, std::make_shared<VSASandboxService>(root),
         std::make_shared<VSANotificationCenter>(root), testLocks_, &noRecords_, &noWellknown_});
    auto environment = std::make_shared<VSAStageForDeleteEnvironment>();
    environment->cache = containers_;
    environment->configuration = config;
    environment->locks = locks_;
    environment->testLocks = testLocks_;
    environment->codeSigning = mapping_.get();
    mapping_->setStageForDeleteEnvironment(environment);
  }

  static VSAValue info(VSAValue entitlements) {
    return VSAValue::Dictionary{{kVSAEntitlementsKey, std::move(entitlements)},
                                {"CDHash", VSAValue("abc")}};
  }
  static VSAValue groups(std::initializer_list<const char*> ids) {
    VSAValue::Array a;
    for (const char* id : ids) a.push_back(VSAValue(id));
    return VSAValue::Dictionary{{kVSAEntitlementApplicationGroups, VSAValue(std::move(a))}};
  }
  VSAResultCode reg(const std::string& id, std::optional<VSAValue> i, VSACommandQueue& q,
                    VSAValue options = VSAValue::dictionary()) {
    return mapping_->processCodeSigningInfo(i, &id, options, &q);
  }
  // The containers queued for deletion, as "identifier/class".
  static std::vector<std::string> staged(const VSACommandQueue& q) {
    std::vector<std::string> out;
    for (const auto& c : q.pendingCommands())
      if (auto s = std::dynamic_pointer_cast<VSACommandStageForDelete>(c))
        for (const auto& id : s->containerIdentities())
          out.push_back(id->identifier() + "/" + std::to_string(id->containerClass()));
    return out;
  }

  // A container of the mobile user on disk and in the cache; returns its directory.
  std::string container(const char* id, VSAContainerClass c) {
    VSAUUID uuid = VSAUUID::random();
    std::string dir =
        *config_->containerDirectoryURLForUserIdentity(personal_, c, false) + "/" + uuid.string();
    fs::create_directories(dir);
    auto identity =
        VSAConcreteContainerIdentity::containerIdentityWithUUID(uuid, personal_, id, c, nullptr);
    VSAMetadata m(identity, std::nullopt, dir, std::nullopt);
    EXPECT_TRUE(m.writeMetadataToDiskWithError(*config_, nullptr));
    EXPECT_TRUE(containers_->addContainerMetadata(m, dir, {}, nullptr));
    return dir;
  }

  VSATestTempDir temp_{"vessa-mapping"};
  std::shared_ptr<VSALocks> locks_ = std::make_shared<VSALocks>();
  std::shared_ptr<VSATestLocks> testLocks_ = std::make_shared<VSATestLocks>(locks_);
  VSAFakeCodeSigningQueries noRecords_;
  VSAFakeWellknownContainers noWellknown_;
  std::string root_, legacyPath_;
  std::shared_ptr<VSAGlobalConfiguration> config_;
  std::shared_ptr<VSAContainerCache> containers_;
  VSAUserIdentityRef personal_;
  std::unique_ptr<VSACodeSigningMapping> mapping_;
};

TEST_F(Mapping, RoundTripAndExternalReads) {
  VSACommandQueue q;
  ASSERT_EQ(reg("com.app", info(VSAValue::dictionary()), q), 1u);
  auto back = mapping_->getCodeSigningInfoForIdentifier("com.app");
  ASSERT_TRUE(back);
  EXPECT_EQ(*back->get("CDHash")->stringValue(), "abc");
  // A placeholder is not shown to clients but is there for the daemon.
  ASSERT_EQ(reg("com.placeholder", info(VSAValue::dictionary()), q,
                VSAValue::Dictionary{
                    {kVSAOptionPlaceholder, VSAValue(true)},
                    {kVSAOptionDataContainerClass, VSAValue(VSAClass::kDataApplication)}}),
            1u);
  EXPECT_FALSE(mapping_->getCodeSigningInfoForIdentifier("com.placeholder"));
  EXPECT_TRUE(mapping_->entitlementsForIdentifier("com.placeholder"));
  EXPECT_EQ(mapping_->dataContainerTypeForIdentifier("com.placeholder"), 2u);
  EXPECT_EQ(mapping_->processCodeSigningInfo(std::nullopt, nullptr, VSAValue::dictionary(), &q),
            18u);
  EXPECT_EQ(q.count(), 0u);
}

TEST_F(Mapping, ChildOfAParentWithoutEntry) {
  VSACommandQueue q;
  ASSERT_EQ(reg("com.app.plugin", info(VSAValue::dictionary()), q,
                VSAValue::Dictionary{{kVSAOptionParentBundleID, VSAValue("com.app")}}),
            1u);
  VSAErrorRef error;
  auto parent = mapping_->codeSigningEntryForIdentifier("com.app", &error);
  ASSERT_TRUE(parent);
  EXPECT_EQ(parent->codeSigningInfo(), VSAValue::dictionary()) << "holds only the child list";
  EXPECT_EQ(*parent->childBundleIdentifiers(), std::vector<std::string>{"com.app.plugin"});
  EXPECT_EQ(*mapping_->parentIdentifierForChildIdentifier("com.app.plugin"), "com.app");
}

TEST_F(Mapping, DroppingTheSystemContainerEntitlementQueuesItsDeletion) {
  VSACommandQueue q;
  VSAValue withContainer = VSAValue::Dictionary{{kVSAEntitlementSystemContainer, VSAValue(true)}};
  ASSERT_EQ(reg("com.service", info(withContainer), q), 1u);
  EXPECT_TRUE(mapping_->identifierHasSystemContainer("com.service"));
  EXPECT_EQ(q.count(), 0u) << "adding it creates nothing here";
  ASSERT_EQ(reg("com.service", info(VSAValue::dictionary()), q), 1u);
  EXPECT_EQ(staged(q), std::vector<std::string>{"com.service/12"});
  // Registering the same info again changes nothing and queues nothing.
  ASSERT_EQ(reg("com.service", info(VSAValue::dictionary()), q), 1u);
  EXPECT_EQ(q.count(), 1u);
}

TEST_F(Mapping, SharedGroupIsQueuedForDeletionOnlyAtTheLastReference) {
  VSACommandQueue q;
  ASSERT_EQ(reg("com.a", info(groups({"group.shared", "group.a"})), q), 1u);
  ASSERT_EQ(reg("com.b", info(groups({"group.shared"})), q), 1u);
  auto counts = mapping_->copyReferenceCountSetOfType(kVSAGroupTypeApplication);
  EXPECT_EQ((*counts)["group.shared"], 2);
  // com.a drops both groups: group.a had one reference, group.shared two.
  ASSERT_EQ(reg("com.a", info(VSAValue::dictionary()), q), 1u);
  EXPECT_EQ(staged(q), std::vector<std::string>{"group.a/7"}) << "only group.a goes";
  ASSERT_EQ(reg("com.b", info(VSAValue::dictionary()), q), 1u);
  EXPECT_EQ(staged(q), (std::vector<std::string>{"group.a/7", "group.shared/7"}));
  EXPECT_EQ(q.count(), 2u);
}

TEST_F(Mapping, QueuedDeletionsStageTheContainersOnDeathRow) {
  std::string shared = container("group.shared", VSAClass::kAppGroup);
  VSACommandQueue q;
  ASSERT_EQ(reg("com.a", info(groups({"group.shared"})), q), 1u);
  ASSERT_EQ(reg("com.a", info(VSAValue::dictionary()), q), 1u);
  ASSERT_EQ(q.count(), 1u);
  VSAResultCode code = 1;
  EXPECT_TRUE(q.executeAllUntilExhaustedOrError(&code)) << code;
  EXPECT_FALSE(fs::exists(shared));
  EXPECT_TRUE(
      fs::exists(config_->deathrowDirectory() + "/" + fs::path(shared).filename().string()));
  VSAErrorRef error;
  auto gone = VSAContainerIdentity::containerIdentityWithUserIdentity(personal_, "group.shared",
                                                                      VSAClass::kAppGroup, nullptr);
  EXPECT_FALSE(containers_->containerForContainerIdentity(*gone, {}, &error));
  EXPECT_EQ(error->resultCode(0), 21u);
}

TEST_F(Mapping, AStagedBundleTakesItsCodeSigningRecordsAlong) {
  std::string bundle = container("com.bundled", VSAClass::kBundleApplication);
  VSACommandQueue q;
  ASSERT_EQ(reg("com.bundled", info(VSAValue::dictionary()), q), 1u);
  auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(
      personal_, "com.bundled", VSAClass::kBundleApplication, nullptr);
  auto environment = std::make_shared<VSAStageForDeleteEnvironment>(
      VSAStageForDeleteEnvironment{containers_, config_, locks_, testLocks_, mapping_.get()});
  q.insertCommand(VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
      environment, {identity}, true, nullptr));
  VSAResultCode code = 1;
  EXPECT_TRUE(q.executeAllUntilExhaustedOrError(&code)) << code;
  EXPECT_FALSE(fs::exists(bundle));
  VSAErrorRef error;
  EXPECT_FALSE(mapping_->codeSigningEntryForIdentifier("com.bundled", &error));
  // A missing container is skipped without error.
  q.insertCommand(VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
      environment, {identity}, true, nullptr));
  EXPECT_TRUE(q.executeAllUntilExhaustedOrError(&code));
}

TEST_F(Mapping, SystemGroupsAreNeverReleasedByARegistration) {
  VSACommandQueue q;
  VSAValue e = VSAValue::Dictionary{{kVSAEntitlementSystemGroups, VSAValue("systemgroup.com.x")}};
  ASSERT_EQ(reg("com.sys", info(e), q), 1u);
  EXPECT_EQ(*mapping_->systemGroupIdentifiersForIdentifier("com.sys"),
            std::vector<std::string>{"systemgroup.com.x"});
  ASSERT_EQ(reg("com.sys", info(VSAValue::dictionary()), q), 1u);
  EXPECT_EQ(q.count(), 0u);
}

TEST_F(Mapping, ForgettingAnIdentifierReleasesItsGroups) {
  VSACommandQueue q;
  ASSERT_EQ(reg("com.a", info(groups({"group.only"})), q), 1u);
  ASSERT_EQ(reg("com.a", std::nullopt, q), 1u);
  EXPECT_EQ(staged(q), std::vector<std::string>{"group.only/7"});
  VSAErrorRef error;
  EXPECT_FALSE(mapping_->codeSigningEntryForIdentifier("com.a", &error));
}

TEST_F(Mapping, CallerRegisteredEntitlementsNeverOverwriteASignature) {
  VSACommandQueue q;
  VSAValue e1 = VSAValue::Dictionary{{"x", VSAValue(1)}};
  VSAValue e2 = VSAValue::Dictionary{{"x", VSAValue(2)}};
  ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(e1, "com.caller", &q), 1u);
  EXPECT_TRUE(mapping_->identifierHasCallerRegisteredEntitlements("com.caller"));
  ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(e2, "com.caller", &q), 1u);
  EXPECT_EQ(*mapping_->entitlementsForIdentifier("com.caller"), e2) << "re-registered";
  ASSERT_EQ(reg("com.signed", info(e1), q), 1u);
  ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(e2, "com.signed", &q), 1u);
  EXPECT_EQ(*mapping_->entitlementsForIdentifier("com.signed"), e1);
  // The same entitlements again are not read again, but only while nothing
  // was written: an entry removed meanwhile is recorded anew.
  mapping_->removeCodeSigningDictionariesForIdentifierAndItsChildren("com.caller", &q);
  ASSERT_FALSE(mapping_->identifierHasCallerRegisteredEntitlements("com.caller"));
  ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(e2, "com.caller", &q), 1u);
  EXPECT_TRUE(mapping_->identifierHasCallerRegisteredEntitlements("com.caller"))
      << "a change to the database ends the memory of what was recorded";
}

TEST_F(Mapping, LegacyMappingFileMovesIntoTheDatabaseOnce) {
  VSACodeSigningEntry old(info(groups({"group.legacy"})), VSAClass::kDataApplication);
  VSAValue file = VSAValue::Dictionary{{"com.legacy.app", old.serialize()}};
  build(&file);
  VSAErrorRef error;
  auto migrated = mapping_->codeSigningEntryForIdentifier("com.legacy.app", &error);
  ASSERT_TRUE(migrated);
  EXPECT_TRUE(migrated->isEqual(old));
  EXPECT_FALSE(fs::exists(legacyPath_)) << "the file goes once something migrated";
  // A file from which nothing migrates stays for the next start.
  VSAValue empty = VSAValue::dictionary();
  build(&empty);
  EXPECT_TRUE(fs::exists(legacyPath_));
}

TEST_F(Mapping, AppsWithoutABundleContainerAreInvalidated) {
  container("com.installed", VSAClass::kBundleApplication);
  VSACommandQueue q;
  ASSERT_EQ(reg("com.installed", info(VSAValue::dictionary()), q), 1u);
  ASSERT_EQ(reg("com.gone", info(VSAValue::dictionary()), q,
                VSAValue::Dictionary{
                    {kVSAOptionDataContainerClass, VSAValue(VSAClass::kDataApplication)}}),
            1u);
  ASSERT_EQ(
      reg("com.gone.plugin", info(VSAValue::dictionary()), q,
          VSAValue::Dictionary{{kVSAOptionParentBundleID, VSAValue("com.gone")},
                               {kVSAOptionDataContainerClass, VSAValue(VSAClass::kDataPlugin)}}),
      1u);
  ASSERT_EQ(mapping_->processCallerRegisteredEntitlements(VSAValue::dictionary(), "com.caller", &q),
            1u);
  EXPECT_EQ(mapping_->invalidateCodeSigningInfoForAppsWithoutBundleContainer(), 1u);
  VSAErrorRef error;
  EXPECT_FALSE(mapping_->codeSigningEntryForIdentifier("com.installed", &error)->isInvalid());
  EXPECT_TRUE(mapping_->codeSigningEntryForIdentifier("com.gone", &error)->isInvalid());
  EXPECT_TRUE(mapping_->codeSigningEntryForIdentifier("com.gone.plugin", &error)->isInvalid())
      << "a plug-in goes with its parent";
  EXPECT_FALSE(mapping_->codeSigningEntryForIdentifier("com.caller", &error)->isInvalid());
}

TEST_F(Mapping, UnclaimedSystemContainersAreReconciledAway) {
  container("com.claimed", VSAClass::kSystemData);
  std::string orphan = container("com.orphan", VSAClass::kSystemData);
  VSACommandQueue q;
  ASSERT_EQ(reg("com.claimed",
                info(VSAValue::Dictionary{{kVSAEntitlementSystemContainer, VSAValue(true)}}), q),
            1u);
  mapping_->reconcileSystemContainersWithCommandQueue(&q);
  EXPECT_EQ(staged(q), std::vector<std::string>{"com.orphan/12"});
  VSAResultCode code = 1;
  EXPECT_TRUE(q.executeAllUntilExhaustedOrError(&code)) << code;
  EXPECT_FALSE(fs::exists(orphan));
}

TEST_F(Mapping, GroupEntitlementShapes) {
  VSAValue e = VSAValue::Dictionary{
      {kVSAEntitlementApplicationGroups, VSAValue::Array{VSAValue("g"), VSAValue("g")}},
      {kVSAEntitlementSystemGroups,
       VSAValue::Array{VSAValue("systemgroup.ok"), VSAValue("noprefix")}}};
  EXPECT_EQ(*VSACodeSigningMapping::copyApplicationGroupEntitlementForIdentifier(
                "id", &e, kVSAEntitlementApplicationGroups),
            std::vector<std::string>{"g"})
      << "duplicates count once";
  VSAValue mixed = VSAValue::Dictionary{
      {kVSAEntitlementApplicationGroups, VSAValue::Array{VSAValue("g"), VSAValue(1)}}};
  EXPECT_FALSE(VSACodeSigningMapping::copyApplicationGroupEntitlementForIdentifier(
      "id", &mixed, kVSAEntitlementApplicationGroups));
  VSACommandQueue q;
  ASSERT_EQ(reg("com.s", info(e), q), 1u);
  EXPECT_EQ(*mapping_->systemGroupIdentifiersForIdentifier("com.s"),
            std::vector<std::string>{"systemgroup.ok"});
}

}  // namespace
