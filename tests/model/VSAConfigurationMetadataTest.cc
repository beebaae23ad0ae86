#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "base/VSAPlist.h"
#include "model/FakePersonaService.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAMetadata.h"
#include "model/VSAPerUserConfiguration.h"
#include "model/VSAUserIdentityCache.h"
#include "platform/VSAFaultInjectingFileSystem.h"
#include "platform/VSALinuxFileSystem.h"

namespace fs = std::filesystem;
using Kind = VSAPersonaAttributes::Kind;
using Op = VSAFileSystem::Op;

namespace {

class Layout : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    fs::create_directories(root_ + "/etc");
    fs::create_directories(root_ + "/private/var/mobile");
    fs::create_directories(root_ + "/private/var/u502");
    std::ofstream(root_ + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                            "other:x:502:502::/private/var/u502:/bin/sh\n";
    VSASystemRoot root(root_);
    auto users = std::make_shared<VSAUserDatabase>(root);
    faults_ = std::make_shared<VSAFaultInjectingFileSystem>(std::make_shared<VSALinuxFileSystem>());
    config_ = std::make_unique<VSAGlobalConfiguration>(
        root, std::make_shared<VSADeviceProperties>(root), users,
        std::make_shared<VSAFileManager>(faults_, users));
    auto personas = std::make_shared<FakePersonaService>();
    personas->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(Kind::Personal, 1000, "P-1000")};
    cache_ = VSAUserIdentityCache::create({personas, users, 501, 501, true, nullptr});
    personal_ = cache_->userIdentityForPersonalPersona();
  }

  // A container of `c` for `owner` with a metadata file; returns the metadata.
  VSAMetadataRef makeContainer(VSAContainerClass c, const VSAUserIdentityRef& owner) {
    std::string base = *config_->containerDirectoryURLForUserIdentity(owner, c, false);
    VSAUUID uuid = VSAUUID::random();
    std::string dir = base + "/" + uuid.string();
    fs::create_directories(dir);
    auto identity =
        VSAConcreteContainerIdentity::containerIdentityWithUUID(uuid, owner, "com.app", c, nullptr);
    auto m = std::make_shared<VSAMetadata>(identity, VSAValue::Dictionary{{"k", VSAValue(1)}}, dir,
                                           std::nullopt);
    VSAErrorRef error;
    EXPECT_TRUE(m->writeMetadataToDiskWithError(*config_, &error));
    return m;
  }
  VSAValue readPlist(const std::string& dir) {
    auto v = VSA_dictionaryWithContentsOfURL(dir + "/" + kVSAMetadataFileName, 0, nullptr);
    return v ? *v : VSAValue();
  }
  void writePlist(const std::string& dir, const VSAValue& v) {
    auto bytes = VSAPlist::serialize(v, VSAPlist::Format::Binary, nullptr);
    VSAWriteFileAtomically(dir + "/" + kVSAMetadataFileName, *bytes, 0644, nullptr);
  }
  // Reads back after changing one key of the file; returns the error message.
  std::string readAfter(const VSAMetadataRef& m, const std::string& key,
                        std::optional<VSAValue> value, VSAResultCode* code,
                        const VSAUserIdentityRef& as = nullptr, bool check = true) {
    VSAValue v = readPlist(m->url());
    if (value)
      v.set(key, *value);
    else
      v.remove(key);
    writePlist(m->url(), v);
    VSAErrorRef error;
    auto back = VSAMetadata::readAndValidateMetadataAtUrl(m->url(), as ? as : personal_, check,
                                                          *config_, *cache_, &error);
    if (back) return "";
    *code = error->resultCode(0);
    return error->message();
  }

  VSATestTempDir temp_{"vessa-layout"};
  std::string root_;
  std::shared_ptr<VSAFaultInjectingFileSystem> faults_;
  std::unique_ptr<VSAGlobalConfiguration> config_;
  std::shared_ptr<VSAUserIdentityCache> cache_;
  VSAUserIdentityRef personal_;
};

TEST_F(Layout, DirectoriesArePlacedOwnedAndRecreated) {
  std::string bundle = config_->bundleDirectory();
  EXPECT_EQ(bundle, root_ + "/private/var/containers/Bundle");
  fs::remove_all(bundle);
  EXPECT_EQ(config_->bundleDirectory(), bundle);
  struct stat st;
  ASSERT_EQ(lstat(bundle.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0755u);
  lstat(config_->transientBundleDirectory().c_str(), &st);
  EXPECT_EQ(st.st_uid, 33u);
  EXPECT_EQ(config_->deathrowDirectory(),
            root_ + "/private/var/root/Library/Caches/com.tamsk.vessad/Dead");
  auto data =
      config_->containerDirectoryURLForUserIdentity(personal_, VSAClass::kDataApplication, false);
  EXPECT_EQ(*data, root_ + "/private/var/mobile/Containers/Data/Application");
  lstat(data->c_str(), &st);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(*config_->containerDirectoryURLForUserIdentity(personal_, VSAClass::kBundleApplication,
                                                           false),
            root_ + "/private/var/containers/Bundle/Application");
  EXPECT_EQ(*config_->containerDirectoryURLForUserIdentity(personal_, VSAClass::kSystemGroup, true),
            root_ + "/private/var/root/Library/Caches/com.tamsk.vessad/Temp/Shared/SystemGroup");
  EXPECT_EQ(
      *config_->containerDirectoryURLForUserIdentity(personal_, VSAClass::kDataApplication, true),
      root_ + "/private/var/mobile/Containers/Temp/Data/Application");
  auto perUser = config_->getPerUserConfigurationForUserIdentity(personal_);
  EXPECT_FALSE(perUser->containerDirectoryURLForContentClass(0, false));
  EXPECT_FALSE(perUser->containerDirectoryURLForContentClass(14, false));
  EXPECT_FALSE(config_->globalContainerBaseURLWithContentClass(VSAClass::kDataApplication, false));
  EXPECT_FALSE(config_->legacyTransientBundleDirectory());
  // The unspecific identity of the same uid shares the personal layout object.
  EXPECT_EQ(config_->getPerUserConfigurationForUserIdentity(cache_->unspecificUserIdentity()),
            perUser);
  EXPECT_EQ(config_->stagingDirectoryURLForUserIdentity(personal_, VSAClass::kAppGroup),
            root_ + "/private/var/mobile/Containers/Staging");
  EXPECT_EQ(config_->stagingDirectoryURLForUserIdentity(personal_, VSAClass::kSystemData),
            config_->stagingDirectory());
  EXPECT_FALSE(config_->migrationFileExistsWithName("marker"));
  std::ofstream(config_->libraryDirectory() + "/marker") << "";
  EXPECT_TRUE(config_->migrationFileExistsWithName("marker"));
}

// A directory ensured once costs one status call later; whatever happens to
// it behind the daemon's back (removed, replaced by a file or a link, a failed
// creation) makes the next call ensure it again.
TEST_F(Layout, EnsuredDirectoriesAreCheckedCheaplyAndRecreatedWhenGone) {
  std::string staging = config_->stagingDirectory();
  int mkdirs = faults_->callCount(Op::Mkdir), lstats = faults_->callCount(Op::Lstat);
  EXPECT_EQ(config_->stagingDirectory(), staging);
  EXPECT_EQ(faults_->callCount(Op::Mkdir), mkdirs) << "no creation attempt for a known directory";
  EXPECT_EQ(faults_->callCount(Op::Lstat), lstats + 2) << "one status call for it and its parent";
  fs::remove_all(staging);
  config_->stagingDirectory();
  EXPECT_TRUE(fs::is_directory(fs::symlink_status(staging))) << "removed: made again";
  fs::remove(staging);
  std::ofstream(staging) << "a file";
  config_->stagingDirectory();
  EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(staging))) << "never replaced by force";
  fs::remove(staging);
  fs::create_directory_symlink(temp_.path() + "/etc", staging);
  config_->stagingDirectory();
  EXPECT_TRUE(fs::is_symlink(fs::symlink_status(staging))) << "a link is not taken for it";
  fs::remove(staging);
  // A creation that fails is not remembered: the next call tries again.
  faults_->failAll(Op::Mkdir, EACCES);
  config_->stagingDirectory();
  EXPECT_FALSE(fs::exists(fs::symlink_status(staging)));
  faults_->reset();
  config_->stagingDirectory();
  EXPECT_TRUE(fs::is_directory(fs::symlink_status(staging)));
}

TEST_F(Layout, MetadataRoundTripsAndIsNeverWrittenInPlace) {
  auto m = makeContainer(VSAClass::kDataApplication, personal_);
  VSAValue raw = readPlist(m->url());
  EXPECT_EQ(*raw.get("VSAMetadataVersion")->stringValue(), "2");
  EXPECT_TRUE(raw.get("VSAMetadataUserIdentity"));
  VSAErrorRef error;
  auto back = VSAMetadata::readAndValidateMetadataAtUrl(m->url(), personal_, true, *config_,
                                                        *cache_, &error);
  ASSERT_TRUE(back) << error->description();
  EXPECT_TRUE(back->containerIdentity()->isEqual(*m->containerIdentity()));
  EXPECT_EQ(back->info()->get("k")->int64Value(), 1);
  EXPECT_EQ(back->url(), m->url());
  // A bundle container's file never carries a user identity.
  auto b = makeContainer(VSAClass::kBundleApplication, cache_->defaultUserIdentity());
  EXPECT_FALSE(readPlist(b->url()).get("VSAMetadataUserIdentity"));
  auto other = cache_->userIdentityForPersonalPersonaWithUID(502, 502);
  auto bundleBack =
      VSAMetadata::readAndValidateMetadataAtUrl(b->url(), other, true, *config_, *cache_, &error);
  ASSERT_TRUE(bundleBack);
  EXPECT_TRUE(VSAUserIdentityEqual(bundleBack->userIdentity(), cache_->defaultUserIdentity()));
}

TEST_F(Layout, AFailedMetadataWriteLeavesTheOldFileIntact) {
  auto m = makeContainer(VSAClass::kDataApplication, personal_);
  std::vector<uint8_t> before;
  std::ifstream in(m->url() + "/" + kVSAMetadataFileName, std::ios::binary);
  before.assign(std::istreambuf_iterator<char>(in), {});
  m->setInfo(VSAValue::Dictionary{{"k", VSAValue(2)}});
  for (Op op : {Op::WriteFile, Op::Rename}) {
    faults_->reset();
    faults_->failNth(op, 1, op == Op::WriteFile ? ENOSPC : EIO);
    VSAErrorRef error;
    EXPECT_FALSE(m->writeMetadataToDiskWithError(*config_, &error));
    EXPECT_EQ(error->resultCode(0), 34u);
    std::ifstream again(m->url() + "/" + kVSAMetadataFileName, std::ios::binary);
    std::vector<uint8_t> now(std::istreambuf_iterator<char>(again), {});
    EXPECT_EQ(now, before) << VSAFileSystem::opName(op);
    for (auto& e : fs::directory_iterator(
             config_->stagingDirectoryURLForUserIdentity(personal_, VSAClass::kDataApplication)))
      ADD_FAILURE() << "left behind " << e.path();
  }
  VSAResultCode code = 0;
  EXPECT_EQ(readAfter(m, "x", std::nullopt, &code), "") << "the old file still validates";
}

TEST_F(Layout, EveryValidationFailureHasItsCodeAndMessage) {
  auto m = makeContainer(VSAClass::kDataApplication, personal_);
  VSAResultCode code = 0;
  auto other = cache_->userIdentityForPersonalPersonaWithUID(502, 502);
  struct Case {
    const char* key;
    std::optional<VSAValue> value;
    const char* message;
  } cases[] = {
      {"VSAMetadataIdentifier", VSAValue(5), "Invalid metadata Identifier: 5 at "},
      {"VSAMetadataUUID", VSAValue(5), "Invalid metadata UUID String: 5 at "},
      {"VSAMetadataUUID", VSAValue("nope"), "Invalid metadata UUID: nope at "},
      {"VSAMetadataContentClass", VSAValue("2"), "Invalid metadata Class: 2 at "},
      {"VSAMetadataContentClass", VSAValue(14), "Invalid metadata Content Class: 14 at "},
      {"VSAMetadataContentClass", VSAValue(0), "Invalid metadata Content Class: 0 at "},
      {"VSAMetadataPersona", VSAValue(502),
       "Incorrect UserId: 502, expecting: 501 for com.app at "},
      {"VSAMetadataInfo", VSAValue("x"), "Invalid metadata Info: x at "},
      {"VSAMetadataUserManagedAssetsDirName", VSAValue(1),
       "Invalid metadata User Managed Dir Name String: 1 at "},
  };
  for (const Case& c : cases) {
    VSAValue saved = readPlist(m->url());
    std::string message = readAfter(m, c.key, c.value, &code);
    EXPECT_EQ(message.rfind(c.message, 0), 0u) << message;
    EXPECT_EQ(code, 29u) << c.key;
    writePlist(m->url(), saved);
  }
  std::string message = readAfter(m, "VSAMetadataIdentifier", VSAValue("com.app"), &code, other);
  EXPECT_EQ(message.rfind("Incorrect User Identity: ", 0), 0u) << message;
  std::ofstream(m->url() + "/" + kVSAMetadataFileName) << "garbage";
  message = readAfter(m, "x", std::nullopt, &code);
  EXPECT_EQ(code, 12u);
  EXPECT_EQ(message.rfind("Failed to read metadata at URL ", 0), 0u);
}

// Files written before user identities were stored carry only the owner uid.
TEST_F(Layout, LegacyFilesWithoutAUserIdentity) {
  auto m = makeContainer(VSAClass::kDataApplication, personal_);
  VSAValue v = readPlist(m->url());
  v.remove("VSAMetadataUserIdentity");
  v.set("VSAMetadataPersona", VSAValue(499));
  writePlist(m->url(), v);
  VSAErrorRef error;
  // 499 is compared against the expected uid first, so it only passes for
  // a caller that expects it; the owner then becomes the mobile user.
  VSAResultCode code = 0;
  EXPECT_NE(readAfter(m, "VSAMetadataPersona", VSAValue(499), &code), "");
  v.set("VSAMetadataPersona", VSAValue(501));
  writePlist(m->url(), v);
  auto back = VSAMetadata::readAndValidateMetadataAtUrl(m->url(), personal_, true, *config_,
                                                        *cache_, &error);
  ASSERT_TRUE(back);
  EXPECT_EQ(back->userIdentity()->posixUID(), 501u);
  EXPECT_EQ(back->userIdentity()->personaType(), kVSAPersonaTypePersonal);
}

TEST_F(Layout, ClassPathCheckCatchesADataContainerUnderABundleTree) {
  auto m = makeContainer(VSAClass::kDataApplication, personal_);
  std::string bundleDir = *config_->containerDirectoryURLForUserIdentity(
      personal_, VSAClass::kBundleApplication, false);
  std::string moved = bundleDir + "/" + m->uuid().string();
  fs::rename(m->url(), moved);
  VSAErrorRef error;
  EXPECT_FALSE(
      VSAMetadata::readAndValidateMetadataAtUrl(moved, personal_, true, *config_, *cache_, &error));
  EXPECT_EQ(error->message().rfind("Invalid metadata-URLs should match: ", 0), 0u);
  EXPECT_TRUE(VSAMetadata::readAndValidateMetadataAtUrl(moved, personal_, false, *config_, *cache_,
                                                        &error));
}

}  // namespace
