#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>

#include "VSAFakeCodeSigning.h"
#include "VSATestTempDir.h"
#include "base/VSAPlist.h"
#include "model/FakePersonaService.h"
#include "model/VSAContainerCache.h"
#include "platform/VSALinuxFileSystem.h"

namespace fs = std::filesystem;
using Kind = VSAPersonaAttributes::Kind;

namespace {

class Cache : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    VSAWriteMobileUser(root_);
    fs::create_directories(root_ + "/private/var/enterprise");
    VSASystemRoot root(root_);
    auto users = std::make_shared<VSAUserDatabase>(root);
    config_ = std::make_shared<VSAGlobalConfiguration>(
        root, std::make_shared<VSADeviceProperties>(root), users,
        std::make_shared<VSAFileManager>(std::make_shared<VSALinuxFileSystem>(), users));
    personas_ = std::make_shared<FakePersonaService>();
    personas_->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(Kind::Personal, 1000, "P", {}),
        FakePersonaService::persona(Kind::Enterprise, 1001, "E", {"com.work"},
                                    root_ + "/private/var/enterprise")};
    identities_ = VSAUserIdentityCache::create({personas_, users, 501, 501, true, nullptr});
    notifications_ = std::make_shared<VSANotificationCenter>(root);
    sandbox_ = std::make_shared<VSASandboxService>(root);
    wellknown_.known = {{"com.wellknown", VSAClass::kSystemData}};
    cache_ = VSAContainerCache::create(
        {identities_, config_, sandbox_, notifications_,
         std::make_shared<VSATestLocks>(std::make_shared<VSALocks>()), &codeSigning_, &wellknown_});
    personal_ = identities_->userIdentityForPersonalPersona();
    enterprise_ = identities_->userIdentityForPersonaUniqueString(std::string("E"), 501, 501);
  }

  // Writes a container on disk (not through the cache); returns its metadata.
  VSAMetadataRef onDisk(const VSAUserIdentityRef& owner, const char* id, VSAContainerClass c,
                        std::string name = "") {
    VSAUUID uuid = VSAUUID::random();
    std::string dir = *config_->containerDirectoryURLForUserIdentity(owner, c, false) + "/" +
                      (name.empty() ? uuid.string() : name);
    fs::create_directories(dir);
    auto identity =
        VSAConcreteContainerIdentity::containerIdentityWithUUID(uuid, owner, id, c, nullptr);
    auto m = std::make_shared<VSAMetadata>(identity, std::nullopt, dir, std::nullopt);
    EXPECT_TRUE(m->writeMetadataToDiskWithError(*config_, nullptr));
    return m;
  }
  VSAContainerIdentityRef identity(const VSAUserIdentityRef& owner, const char* id,
                                   VSAContainerClass c) {
    return VSAContainerIdentity::containerIdentityWithUserIdentity(owner, id, c, nullptr);
  }
  int sandboxItems(uid_t uid) {
    int n = 0;
    sandbox_->iterateUserStateItems(uid, [&](const VSASandboxItem&) { return ++n, true; });
    return n;
  }

  VSATestTempDir temp_{"vessa-cache"};
  std::string root_;
  VSAFakeCodeSigningQueries codeSigning_;
  VSAFakeWellknownContainers wellknown_;
  std::shared_ptr<VSAGlobalConfiguration> config_;
  std::shared_ptr<FakePersonaService> personas_;
  std::shared_ptr<VSAUserIdentityCache> identities_;
  std::shared_ptr<VSANotificationCenter> notifications_;
  std::shared_ptr<VSASandboxService> sandbox_;
  std::shared_ptr<VSAContainerCache> cache_;
  VSAUserIdentityRef personal_, enterprise_;
};

TEST_F(Cache, BuildsFromDiskSkippingBadNamesAndWrongClasses) {
  onDisk(personal_, "com.app", VSAClass::kDataApplication);
  onDisk(personal_, "com.named", VSAClass::kDataApplication, "Foo");  // not a UUID name
  auto misplaced = onDisk(personal_, "com.bundle", VSAClass::kDataApplication);
  // A metadata file that names another class is skipped (class-path check).
  VSAValue v =
      *VSA_dictionaryWithContentsOfURL(misplaced->url() + "/" + kVSAMetadataFileName, 0, nullptr);
  v.set("VSAMetadataContentClass", VSAValue(VSAClass::kBundleApplication));
  VSA_writeToURL(v, misplaced->url() + "/" + kVSAMetadataFileName, 0, nullptr);
  auto all =
      cache_->allContainersForUserIdentity(personal_, VSAClass::kDataApplication, {}, nullptr);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ((*all)[0]->identifier(), "com.app");
  // Well-known names count in Data/System only.
  onDisk(personal_, "com.wellknown", VSAClass::kSystemData, "com.wellknown");
  EXPECT_EQ(
      cache_->allContainersForUserIdentity(personal_, VSAClass::kSystemData, {}, nullptr)->size(),
      1u);
  EXPECT_FALSE(VSAContainerCache::containerURLIsValidForContainerClass(
      "/x/com.wellknown", VSAClass::kSystemGroup, wellknown_));
}

TEST_F(Cache, HostileMetadataFilesCostOnlyTheirOwnContainer) {
  onDisk(personal_, "com.good", VSAClass::kDataApplication);
  auto file = [](const VSAMetadataRef& m) { return m->url() + "/" + kVSAMetadataFileName; };
  // A FIFO: opening it for reading would wait for a writer for ever.
  auto fifo = onDisk(personal_, "com.fifo", VSAClass::kDataApplication);
  fs::remove(file(fifo));
  ASSERT_EQ(::mkfifo(file(fifo).c_str(), 0644), 0);
  // A well-formed metadata file padded past the size limit.
  auto big = onDisk(personal_, "com.big", VSAClass::kDataApplication);
  big->setInfo(VSAValue(VSAValue::Dictionary{{"pad", VSAValue(std::string(100 << 10, 'p'))}}));
  ASSERT_TRUE(big->writeMetadataToDiskWithError(*config_, nullptr));
  // The same metadata as XML text: never what the daemon writes.
  auto xml = onDisk(personal_, "com.xml", VSAClass::kDataApplication);
  VSAValue dict = *VSA_dictionaryWithContentsOfURL(file(xml), 0, nullptr);
  auto text = VSAPlist::serialize(dict, VSAPlist::Format::XML, nullptr);
  ASSERT_TRUE(VSAWriteFileAtomically(file(xml), *text, 0644, nullptr));
  // A symbolic link to a valid metadata file, and a directory in its place.
  auto link = onDisk(personal_, "com.link", VSAClass::kDataApplication);
  auto elsewhere = onDisk(personal_, "com.elsewhere", VSAClass::kDataPlugin);
  fs::remove(file(link));
  fs::create_symlink(file(elsewhere), file(link));
  auto dir = onDisk(personal_, "com.dir", VSAClass::kDataApplication);
  fs::remove(file(dir));
  fs::create_directory(file(dir));

  auto listing = std::async(std::launch::async, [&] {
    return cache_->allContainersForUserIdentity(personal_, VSAClass::kDataApplication, {}, nullptr);
  });
  if (listing.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
    ADD_FAILURE() << "listing the class blocked on a FIFO";
    int w = ::open(file(fifo).c_str(), O_WRONLY | O_NONBLOCK);  // let the reader go
    if (w >= 0) ::close(w);
  }
  auto all = listing.get();
  ASSERT_TRUE(all);
  std::vector<std::string> ids;
  for (const auto& m : *all) ids.push_back(m->identifier());
  EXPECT_EQ(ids, std::vector<std::string>{"com.good"});

  // Each one alone is the "unreadable" failure, code 12.
  for (const auto& m : {fifo, big, xml, link, dir}) {
    VSAErrorRef error;
    EXPECT_FALSE(VSAMetadata::readAndValidateMetadataAtUrl(m->url(), personal_, true, *config_,
                                                           *identities_, &error))
        << m->identifier();
    ASSERT_TRUE(error) << m->identifier();
    EXPECT_EQ(error->resultCode(0), VSAResult::kMetadataUnreadable) << m->identifier();
  }
  // Just under the limit is still read.
  auto fits = onDisk(personal_, "com.fits", VSAClass::kDataApplication);
  fits->setInfo(VSAValue(VSAValue::Dictionary{{"pad", VSAValue(std::string(60 << 10, 'p'))}}));
  ASSERT_TRUE(fits->writeMetadataToDiskWithError(*config_, nullptr));
  EXPECT_TRUE(VSAMetadata::readAndValidateMetadataAtUrl(fits->url(), personal_, true, *config_,
                                                        *identities_, nullptr));
}

TEST_F(Cache, HugeSparseMetadataFileIsRefusedByItsSize) {
  onDisk(personal_, "com.good", VSAClass::kDataApplication);
  auto sparse = onDisk(personal_, "com.sparse", VSAClass::kDataApplication);
  std::string path = sparse->url() + "/" + kVSAMetadataFileName;
  // 64 GiB of holes: reading it whole would exhaust memory at every start.
  ASSERT_EQ(::truncate(path.c_str(), off_t{64} << 30), 0);
  auto all =
      cache_->allContainersForUserIdentity(personal_, VSAClass::kDataApplication, {}, nullptr);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ((*all)[0]->identifier(), "com.good");
  VSAErrorRef error;
  EXPECT_FALSE(VSAMetadata::readAndValidateMetadataAtUrl(sparse->url(), personal_, true, *config_,
                                                         *identities_, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->resultCode(0), VSAResult::kMetadataUnreadable);
}

TEST_F(Cache, VanishedMetadataIsReportedOnceThenNotFound) {
  auto m = onDisk(personal_, "com.app", VSAClass::kDataApplication);
  auto id = identity(personal_, "com.app", VSAClass::kDataApplication);
  VSAErrorRef error;
  ASSERT_TRUE(cache_->containerForContainerIdentity(*id, {}, &error));
  fs::remove(m->url() + "/" + kVSAMetadataFileName);
  EXPECT_FALSE(cache_->containerForContainerIdentity(*id, {}, &error));
  EXPECT_EQ(error->resultCode(0), 44u);
  EXPECT_FALSE(cache_->containerForContainerIdentity(*id, {}, &error));
  EXPECT_EQ(error->resultCode(0), 21u);
}

TEST_F(Cache, KernelLookupAvoidsBuildingTheClassMap) {
  auto m = onDisk(personal_, "com.app", VSAClass::kDataApplication);
  ASSERT_TRUE(cache_->setSandboxContainerMappingForUserIdentity(
      personal_, "com.app", VSAClass::kDataApplication, m->url()));
  auto found = cache_->containerForContainerIdentity(
      *identity(personal_, "com.app", VSAClass::kDataApplication), {.allowKernelLookup = true},
      nullptr);
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), m->url());
  EXPECT_FALSE(cache_->hasClassMap(personal_, VSAClass::kDataApplication, false));
}

TEST_F(Cache, SandboxMappingRules) {
  EXPECT_FALSE(cache_->shouldRegisterSandboxMappingWithUserIdentity(enterprise_, "com.x",
                                                                    VSAClass::kBundleApplication))
      << "enterprise bundle mappings are never pushed";
  EXPECT_TRUE(cache_->shouldRegisterSandboxMappingWithUserIdentity(enterprise_, "group.g",
                                                                   VSAClass::kAppGroup));
  EXPECT_TRUE(cache_->shouldRegisterSandboxMappingWithUserIdentity(enterprise_, "com.work",
                                                                   VSAClass::kDataApplication));
  EXPECT_FALSE(cache_->shouldRegisterSandboxMappingWithUserIdentity(personal_, "com.work",
                                                                    VSAClass::kDataApplication));
  EXPECT_TRUE(cache_->shouldRegisterSandboxMappingWithUserIdentity(personal_, "com.unlisted",
                                                                   VSAClass::kDataApplication));
  EXPECT_FALSE(cache_->setSandboxContainerMappingForUserIdentity(
      personal_, "com.bundle", VSAClass::kBundleApplication, "/x"))
      << "bundle classes have no sandbox item type";
}

TEST_F(Cache, AContainerDirectoryThatIsALinkIsNotRead) {
  // An entry of the class directory that links to a container elsewhere
  // (another class here): the build reads below the class directory only.
  onDisk(personal_, "com.app", VSAClass::kDataApplication);
  auto elsewhere = onDisk(personal_, "com.plugin", VSAClass::kDataPlugin);
  std::string classDir =
      *config_->containerDirectoryURLForUserIdentity(personal_, VSAClass::kDataApplication, false);
  fs::create_directory_symlink(elsewhere->url(), classDir + "/" + VSAUUID::random().string());
  auto all =
      cache_->allContainersForUserIdentity(personal_, VSAClass::kDataApplication, {}, nullptr);
  ASSERT_TRUE(all);
  ASSERT_EQ(all->size(), 1u);
  EXPECT_EQ((*all)[0]->identifier(), "com.app");
}

TEST_F(Cache, AReplacedEntryTakesItsKeyWithIt) {
  // The map's keys are views of the entries' identifiers: replacing an entry
  // must not leave a key that views the freed one (AddressSanitizer builds
  // catch the read; the look-ups below catch a lost or doubled entry).
  auto first = onDisk(personal_, "com.app", VSAClass::kDataApplication);
  ASSERT_TRUE(
      cache_->allContainersForUserIdentity(personal_, VSAClass::kDataApplication, {}, nullptr));
  for (int round = 0; round < 3; ++round) {
    auto next = std::make_shared<VSAMetadata>(*first);
    next->setUuid(VSAUUID::random());
    std::string url = first->url() + "-" + std::to_string(round);
    fs::create_directories(url);
    next->setUrl(url);
    ASSERT_TRUE(next->writeMetadataToDiskWithError(*config_, nullptr));
    ASSERT_TRUE(cache_->addContainerMetadata(*next, url, {}, nullptr));
    next.reset();
    auto all =
        cache_->allContainersForUserIdentity(personal_, VSAClass::kDataApplication, {}, nullptr);
    ASSERT_TRUE(all);
    ASSERT_EQ(all->size(), 1u);
    EXPECT_EQ((*all)[0]->url(), url);
    ASSERT_TRUE(cache_->removeContainerForUserIdentity(personal_, VSAClass::kDataApplication,
                                                       "com.app", false, nullptr));
    ASSERT_TRUE(cache_->addContainerMetadata(*first, first->url(), {}, nullptr));
  }
  auto found = cache_->containerForContainerIdentity(
      *identity(personal_, "com.app", VSAClass::kDataApplication));
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), first->url());
}

TEST_F(Cache, AddRemoveAndInvalidateAnEnterpriseIdentity) {
  auto m = onDisk(enterprise_, "com.work", VSAClass::kDataApplication);
  ASSERT_TRUE(cache_->addContainerMetadata(*m, m->url(), {.updateSandbox = true}, nullptr));
  EXPECT_EQ(sandboxItems(501), 1);
  ASSERT_TRUE(cache_->allContainersForUserIdentity(enterprise_, VSAClass::kAppGroup,
                                                   {.transient = true}, nullptr));
  EXPECT_TRUE(cache_->hasClassMap(enterprise_, VSAClass::kDataApplication, false));
  EXPECT_TRUE(cache_->hasClassMap(enterprise_, VSAClass::kAppGroup, true));
  // The enterprise persona goes away: its maps and mappings go, one notification.
  personas_->personas->pop_back();
  identities_->flush();
  EXPECT_FALSE(cache_->hasClassMap(enterprise_, VSAClass::kDataApplication, false));
  EXPECT_FALSE(cache_->hasClassMap(enterprise_, VSAClass::kAppGroup, true));
  EXPECT_EQ(sandboxItems(501), 0);
  EXPECT_EQ(notifications_->postedNames(),
            std::vector<std::string>{CONTAINER_NOTIFY_USER_INVALIDATED});
  // Removing from a rebuilt map drops the entry.
  auto p = onDisk(personal_, "com.app", VSAClass::kDataApplication);
  ASSERT_TRUE(cache_->containerForContainerIdentity(
      *identity(personal_, "com.app", VSAClass::kDataApplication)));
  ASSERT_TRUE(cache_->removeContainerForUserIdentity(personal_, VSAClass::kDataApplication,
                                                     "com.app", false, nullptr));
  VSAErrorRef error;
  EXPECT_FALSE(cache_->containerForContainerIdentity(
      *identity(personal_, "com.app", VSAClass::kDataApplication), {}, &error));
  EXPECT_EQ(error->resultCode(0), 21u) << "the map is not rebuilt from disk once built";
}

}  // namespace
