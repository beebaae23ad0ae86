// Per-container maintenance: a new directory UUID, the default structure
// made again, and info values read and written through the metadata file,
// which the app may rewrite but which never speaks for another container.
#include <gtest/gtest.h>
#include <sys/acl.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <future>

#include "VSAContainerTestRoot.h"

namespace fs = std::filesystem;

namespace {

class Maintenance : public VSAContainerTestRoot {
 protected:
  VSAResultCode regenerate(const VSAContainerIdentityRef& identity) {
    VSAResultCode code = VSAResult::kSuccess;
    installer()->regenerateDirectoryUUIDWithContainerIdentity(identity, &code);
    return code;
  }
  VSAResultCode setInfo(const std::string& id, const std::optional<VSAValue>& value,
                        const VSAValue& key = VSAValue("k")) {
    VSAResultCode code = VSAResult::kSuccess;
    installer()->setInfoValue(value ? &*value : nullptr, &key, identity(id), true, &code);
    return code;
  }
  std::optional<VSAValue> info(const std::string& id, VSAResultCode* code,
                               const VSAValue& key = VSAValue("k")) {
    *code = VSAResult::kSuccess;
    return installer()->infoValueForKey(&key, identity(id), true, code);
  }
  // What an app can write into its own container: a metadata file naming
  // whatever identifier, class and UUID it likes.
  void forge(const std::string& dir, const std::string& id, VSAContainerClass c,
             const VSAUUID& uuid) {
    auto owner = VSAUserIdentity::isUserIdentityRequiredForContainerClass(c)
                     ? user_
                     : context_->userIdentityCache->defaultUserIdentity();
    VSAMetadata forged(
        VSAConcreteContainerIdentity::containerIdentityWithUUID(uuid, owner, id, c, nullptr),
        std::nullopt, dir, std::nullopt);
    ASSERT_TRUE(forged.writeMetadataToDiskWithError(*context_->globalConfiguration, nullptr));
  }
  static std::string aclOf(const std::string& path) {
    acl_t acl = acl_get_file(path.c_str(), ACL_TYPE_ACCESS);
    if (!acl) return "none";
    char* text = acl_to_text(acl, nullptr);
    std::string result = text ? text : "";
    acl_free(text);
    acl_free(acl);
    return result;
  }
};

TEST_F(Maintenance, RegeneratingRenamesTheDirectoryAndKeepsTheIdentity) {
  VSAResultCode code;
  auto made = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(made) << code;
  std::ofstream(made->url() + "/Documents/kept") << "x";
  std::string first = made->url();
  for (VSAContainerIdentityRef named : std::vector<VSAContainerIdentityRef>{
           made->containerIdentity(), identity("com.example.app")}) {
    ASSERT_EQ(regenerate(named), VSAResult::kSuccess);
    auto moved = lookup("com.example.app");
    ASSERT_TRUE(moved);
    EXPECT_NE(moved->url(), first);
    EXPECT_EQ(fs::path(moved->url()).parent_path(), fs::path(first).parent_path());
    EXPECT_EQ(moved->uuid(), made->uuid());
    EXPECT_TRUE(fs::exists(moved->url() + "/Documents/kept"));
    EXPECT_FALSE(fs::exists(first));
    first = moved->url();
  }
  EXPECT_EQ(entries(classDirectory()), 1u);
  // A UUID that names no container, and a well-known system container, whose
  // directory carries its name rather than a UUID.
  auto stranger = VSAConcreteContainerIdentity::containerIdentityWithUUID(
      VSAUUID::random(), user_, "com.example.app", VSAClass::kDataApplication, nullptr);
  EXPECT_EQ(regenerate(stranger), VSAResult::kContainerNotFound);
  auto wellKnown =
      create(*installer(), "systemgroup.com.tamsk.launcher", &code, false, VSAClass::kSystemGroup);
  ASSERT_TRUE(wellKnown) << code;
  EXPECT_EQ(regenerate(wellKnown->containerIdentity()), VSAResult::kInvalidArgument);
  EXPECT_TRUE(fs::is_directory(wellKnown->url()));
  // A failed rename (48) leaves the container where it was and findable.
  faults_->failAll(VSAFileSystem::Op::Rename, EIO);
  EXPECT_EQ(regenerate(made->containerIdentity()), 48u);
  faults_->reset();
  EXPECT_EQ(lookup("com.example.app")->url(), first);
}

TEST_F(Maintenance, RecreatingTheStructureRestoresMissingDirectoriesAndSystemACLs) {
  VSAResultCode code;
  auto app = create(*installer(), "com.example.app", &code);
  auto system =
      create(*installer(), "systemgroup.com.example.shared", &code, false, VSAClass::kSystemGroup);
  ASSERT_TRUE(app && system) << code;
  const auto appShape = shapeOf(app->url());
  const auto systemShape = shapeOf(system->url());
  const std::string libraryACL = aclOf(system->url() + "/Library");
  fs::remove_all(app->url() + "/Library");
  fs::create_directories(system->url() + "/Library/Stray");
  ASSERT_EQ(::chmod((system->url() + "/Library").c_str(), 0777), 0);
  ASSERT_NE(aclOf(system->url() + "/Library"), libraryACL);
  for (const auto& m : {app, system})
    EXPECT_TRUE(
        installer()->recreateDefaultStructureWithContainerIdentity(m->containerIdentity(), &code))
        << code;
  EXPECT_EQ(shapeOf(app->url()), appShape);
  EXPECT_EQ(aclOf(system->url() + "/Library"), libraryACL);
  auto systemNow = shapeOf(system->url());
  EXPECT_EQ(systemNow.erase("Library/Stray"), 1u);  // kept, and given the system ACL
  EXPECT_EQ(systemNow, systemShape);
  code = VSAResult::kSuccess;
  EXPECT_FALSE(installer()->recreateDefaultStructureWithContainerIdentity(
      identity("com.example.no"), &code));
  EXPECT_EQ(code, VSAResult::kContainerNotFound);
}

TEST_F(Maintenance, InfoValuesAreWrittenThroughTheMetadataFileAndRemovable) {
  VSAResultCode code;
  auto made = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(made) << code;
  EXPECT_FALSE(info("com.example.app", &code));
  EXPECT_EQ(code, 24u);
  EXPECT_EQ(setInfo("com.example.app", VSAValue(VSAValue::Array{VSAValue("a"), VSAValue(2u)})),
            VSAResult::kSuccess);
  auto value = info("com.example.app", &code);
  ASSERT_TRUE(value) << code;
  EXPECT_EQ(value->arrayValue()->size(), 2u);
  // On disk, so that a new daemon reads it too; and nothing left in staging.
  restart();
  EXPECT_TRUE(info("com.example.app", &code)) << code;
  EXPECT_EQ(entries(staging(VSAClass::kDataApplication)), 0u);
  // Keys must be strings; values must leave a file the daemon can read back.
  EXPECT_FALSE(info("com.example.app", &code, VSAValue(int64_t{1})));
  EXPECT_EQ(code, VSAResult::kOutOfRange);
  EXPECT_EQ(setInfo("com.example.app", VSAValue("v"), VSAValue(true)), VSAResult::kOutOfRange);
  EXPECT_EQ(setInfo("com.example.app", VSAValue(std::string(kVSAMetadataFileMaxSize, 'x'))),
            VSAResult::kOutOfRange);
  EXPECT_TRUE(lookup("com.example.app"));
  // A failed write changes nothing.
  faults_->failAll(VSAFileSystem::Op::Rename, EIO);
  EXPECT_EQ(setInfo("com.example.app", VSAValue("other")), VSAResult::kWriteFailed);
  faults_->reset();
  EXPECT_EQ(info("com.example.app", &code)->arrayValue()->size(), 2u);
  // No value removes the key.
  EXPECT_EQ(setInfo("com.example.app", std::nullopt), VSAResult::kSuccess);
  EXPECT_FALSE(info("com.example.app", &code));
  EXPECT_EQ(code, 24u);
  EXPECT_EQ(setInfo("com.example.missing", VSAValue("v")), VSAResult::kContainerNotFound);
}

TEST_F(Maintenance, AMetadataFileNamingAnotherContainerIsOnlyItsOwnReadFailure) {
  VSAResultCode code;
  auto sys = create(*installer(), "com.example.sys", &code, false, VSAClass::kSystemData);
  auto app = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(sys && app) << code;
  auto appIdentity = identity("com.example.app");
  // Every operation that reads the app's metadata file again (commands 5,
  // 6, 7, 28 and the protection change of 21), with the code it answers
  // (none for the protection change, which is made, and only not recorded).
  std::vector<std::pair<const char*, std::function<std::optional<VSAResultCode>()>>> rereads = {
      {"set info", [&] { return setInfo("com.example.app", VSAValue("v")); }},
      {"read info", [&] { return info("com.example.app", &code), std::optional(code); }},
      {"metadata",
       [&] {
         code = VSAResult::kSuccess;
         installer()->metadataWithContainerIdentity(appIdentity, &code);
         return std::optional(code);
       }},
      {"assets path",
       [&] {
         code = VSAResult::kSuccess;
         bool existed = false;
         installer()->userManagedAssetsPathWithContainerIdentity(appIdentity, false, true, &existed,
                                                                 &code);
         return std::optional(code);
       }},
      {"protection", [&] {
         std::promise<VSAResultCode> done;
         context_->dataProtectionManager->setDataProtectionOnDataContainerForContainerIdentity(
             *appIdentity, 3, false, false, [&](VSAResultCode c) { done.set_value(c); });
         done.get_future().wait();
         return std::optional<VSAResultCode>();
       }}};
  struct Forgery {
    const char* id;
    VSAContainerClass c;
    VSAUUID uuid;
  };
  const Forgery forgeries[] = {
      {"com.example.sys", VSAClass::kSystemData, sys->uuid()},              // the system container
      {"com.example.app", VSAClass::kDataApplication, VSAUUID::random()}};  // another UUID
  for (const auto& [name, run] : rereads) {
    for (const auto& forgery : forgeries) {
      SCOPED_TRACE(std::string(name) + " of a file claiming " + forgery.id);
      forge(app->url(), forgery.id, forgery.c, forgery.uuid);
      if (auto result = run()) {
        EXPECT_EQ(*result, VSAResult::kMetadataUnreadable);
      }
      auto system = lookup("com.example.sys", VSAClass::kSystemData);
      ASSERT_TRUE(system);
      EXPECT_EQ(system->url(), sys->url());
      auto own = lookup("com.example.app");
      ASSERT_TRUE(own);
      EXPECT_EQ(own->url(), app->url());
      EXPECT_EQ(own->uuid(), app->uuid());
      ASSERT_TRUE(app->writeMetadataToDiskWithError(*context_->globalConfiguration, nullptr));
    }
  }
  // The genuine file is read as before.
  EXPECT_EQ(setInfo("com.example.app", VSAValue("v")), VSAResult::kSuccess);
  EXPECT_TRUE(info("com.example.app", &code)) << code;
}

TEST_F(Maintenance, DiskUsageCountsTheContainersBytesForClientsThatMayLookItUp) {
  VSAResultCode code;
  auto made = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(made) << code;
  code = VSAResult::kSuccess;
  auto empty = installer()->diskUsageWithContainerIdentity(identity("com.example.app"), &code);
  ASSERT_TRUE(empty) << code;
  std::ofstream(made->url() + "/Documents/blob") << std::string(100000, 'x');
  auto full = installer()->diskUsageWithContainerIdentity(identity("com.example.app"), &code);
  ASSERT_TRUE(full) << code;
  EXPECT_GE(*full, *empty + 100000);
  EXPECT_LT(*full, *empty + 100000 + 65536);
  // Another app may not measure it; a missing container is 21.
  auto stranger = connection("com.example.stranger", false, false);
  EXPECT_FALSE(stranger->diskUsageWithContainerIdentity(identity("com.example.app"), &code));
  EXPECT_EQ(code, VSAResult::kNotEntitled);
  code = VSAResult::kSuccess;
  EXPECT_FALSE(installer()->diskUsageWithContainerIdentity(identity("com.example.none"), &code));
  EXPECT_EQ(code, VSAResult::kContainerNotFound);
}

}  // namespace
