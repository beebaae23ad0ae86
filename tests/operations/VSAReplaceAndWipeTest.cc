// Replace, content wipe and replace recovery: their codes, what they leave
// on disk, and what a crash after any file-system call of theirs leaves
// once the next start has run.
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "VSAContainerTestRoot.h"
#include "VSATestLog.h"
#include "base/VSACommands.h"
#include "base/VSAPlist.h"
#include "daemon/VSACommandHandlers.h"
#include "operations/VSAReplaceFile.h"

namespace fs = std::filesystem;

namespace {

class ReplaceAndWipe : public VSAContainerTestRoot {
 protected:
  std::string replaceDirectory() { return context_->globalConfiguration->replaceDirectory(); }
  // The UUID recorded in a container's metadata file.
  std::string uuidOnDisk(const std::string& url) {
    VSAErrorRef error;
    auto m = VSAMetadata::readAndValidateMetadataAtUrl(
        url, user_, false, *context_->globalConfiguration, *context_->userIdentityCache, &error);
    return m ? m->uuid().string() : "unreadable";
  }
  VSAResultCode wipe(VSAClientConnection& c, const std::string& id,
                     VSAContainerClass cls = VSAClass::kDataApplication) {
    VSAResultCode code = VSAResult::kSuccess;
    c.deleteDataContainerContentWithContainerIdentity(identity(id, cls), &code);
    return code;
  }
  size_t stagedItems() { return entries(staging(VSAClass::kDataApplication)); }
};

TEST_F(ReplaceAndWipe, ArgumentsThatCannotWorkFailBeforeAnythingMoves) {
  auto c = installer();
  VSAResultCode code;
  auto a = create(*c, "com.example.a", &code);
  auto b = create(*c, "com.example.b", &code);
  auto bundle = create(*c, "com.example.bundle", &code, false, VSAClass::kBundleApplication);
  ASSERT_TRUE(a && b && bundle) << code;
  auto other =
      VSAUserIdentity::make(502, 502, root_ + "/private/var/other", "OTHER-PERSONA", 1, 1001);
  ASSERT_TRUE(other && !other->isEqualToUserIdentity(*user_));
  auto plainA = identity("com.example.a");
  auto missing = VSAConcreteContainerIdentity::containerIdentityWithUUID(
      VSAUUID::random(), user_, "com.example.missing", VSAClass::kDataApplication, nullptr);
  auto foreign = VSAConcreteContainerIdentity::containerIdentityWithUUID(
      b->uuid(), other, "com.example.b", VSAClass::kDataApplication, nullptr);
  struct Case {
    const char* what;
    VSAContainerIdentityRef oldIdentity, newIdentity;
    bool preserve;
    VSAResultCode expected;
  } cases[] = {
      {"itself", a->containerIdentity(), a->containerIdentity(), false, 22},
      {"itself, preserving", a->containerIdentity(), a->containerIdentity(), true, 22},
      {"other class", a->containerIdentity(), bundle->containerIdentity(), false, 23},
      {"other persona", a->containerIdentity(), foreign, false, 76},
      {"missing new", a->containerIdentity(), missing, false, 21},
      {"missing old", missing, b->containerIdentity(), false, 21},
      {"new without UUID", a->containerIdentity(), identity("com.example.b"), false, 11},
      {"plain old, preserving", plainA, b->containerIdentity(), true, 11},
  };
  for (const auto& k : cases) {
    SCOPED_TRACE(k.what);
    code = VSAResult::kSuccess;
    EXPECT_FALSE(
        c->replaceContainerIdentity(k.oldIdentity, k.newIdentity, k.preserve, false, &code));
    EXPECT_EQ(code, k.expected);
    EXPECT_EQ(entries(replaceDirectory()), 0u);
    EXPECT_EQ(stagedItems(), 0u);
    EXPECT_TRUE(fs::is_directory(a->url()));
    EXPECT_TRUE(fs::is_directory(b->url()));
  }
}

TEST_F(ReplaceAndWipe, AReplaceRequestWithoutANewUUIDIsRefusedByTheReplaceItself) {
  auto c = installer();
  VSAResultCode code;
  auto a = create(*c, "com.example.a", &code);
  auto b = create(*c, "com.example.b", &code);
  ASSERT_TRUE(a && b) << code;
  VSAValue request =
      VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReplaceContainer)},
                           {"OldIdentifier", VSAValue("com.example.a")},
                           {"OldContainerClass", VSAValue(VSAClass::kDataApplication)},
                           {"OldContainerUUID", VSAValue(a->uuid())},
                           {"NewIdentifier", VSAValue("com.example.b")},
                           {"NewContainerClass", VSAValue(VSAClass::kDataApplication)}};
  VSATestLog log;
  ASSERT_TRUE(log.open(root_ + "/test.log"));
  VSAValue reply = VSAValue::dictionary();
  code = VSAResult::kSuccess;
  VSAHandleReplaceContainer(request, reply, *c, &code);
  EXPECT_EQ(code, VSAResult::kInvalidArgument);
  EXPECT_TRUE(log.contains("Can't act on an invalid object: newUUID: (null), Class: 2"))
      << log.text();
  EXPECT_EQ(entries(replaceDirectory()), 0u);
  EXPECT_TRUE(fs::is_directory(a->url()) && fs::is_directory(b->url()));
}

TEST_F(ReplaceAndWipe, AReplaceMovesTheNewContainerInAndTheOldOneToDeathRow) {
  auto c = installer();
  VSAResultCode code;
  auto a = create(*c, "com.example.a", &code);
  auto b = create(*c, "com.example.b", &code);
  ASSERT_TRUE(a && b) << code;
  put(a->url() + "/Documents/old", "a");
  put(b->url() + "/Documents/new", "b");
  ASSERT_TRUE(c->replaceContainerIdentity(a->containerIdentity(), b->containerIdentity(), false,
                                          false, &code))
      << code;
  // The result is named by the new identity's UUID, in the class directory.
  std::string dest = classDirectory() + "/" + b->uuid().string();
  EXPECT_EQ(read(dest + "/Documents/new"), "b");
  EXPECT_FALSE(fs::exists(a->url()));
  EXPECT_FALSE(fs::exists(b->url()));
  EXPECT_FALSE(lookup("com.example.a"));
  auto found = lookup("com.example.b");
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), dest);
  EXPECT_EQ(found->uuid(), b->uuid());
  EXPECT_EQ(entries(replaceDirectory()), 0u);
  EXPECT_EQ(stagedItems(), 0u);
  EXPECT_EQ(emptyDeathRow(), VSAResult::kSuccess);
  EXPECT_EQ(entries(classDirectory()), 1u);
}

TEST_F(ReplaceAndWipe, AFailedSecondRenamePutsTheOldContainerBack) {
  auto c = installer();
  VSAResultCode code;
  auto a = create(*c, "com.example.a", &code);
  auto b = create(*c, "com.example.b", &code);
  ASSERT_TRUE(a && b) << code;
  put(a->url() + "/Documents/old", "a");
  // Renames: the replace file into place, old -> staging, new -> destination.
  faults_->reset();
  faults_->failNth(VSAFileSystem::Op::Rename, 3, EIO);
  EXPECT_FALSE(c->replaceContainerIdentity(a->containerIdentity(), b->containerIdentity(), false,
                                           false, &code));
  EXPECT_EQ(code, 15u);
  faults_->reset();
  EXPECT_EQ(read(a->url() + "/Documents/old"), "a");
  auto found = lookup("com.example.a");
  ASSERT_TRUE(found);
  EXPECT_EQ(found->url(), a->url());
  EXPECT_TRUE(lookup("com.example.b"));
  EXPECT_EQ(entries(replaceDirectory()), 0u);
  EXPECT_EQ(stagedItems(), 0u);
}

TEST_F(ReplaceAndWipe, AWipeKeepsPathAndUUIDAndEmptiesTheContainer) {
  auto c = installer();
  VSAResultCode code;
  auto before = create(*c, "com.example.app", &code);
  ASSERT_TRUE(before) << code;
  const auto shape = shapeOf(before->url());
  put(before->url() + "/Documents/diary", "secret");
  EXPECT_EQ(wipe(*c, "com.example.app"), VSAResult::kSuccess);
  auto after = lookup("com.example.app");
  ASSERT_TRUE(after);
  EXPECT_EQ(after->url(), before->url());
  EXPECT_EQ(after->uuid(), before->uuid());
  EXPECT_FALSE(fs::exists(before->url() + "/Documents/diary"));
  EXPECT_EQ(shapeOf(after->url()), shape);
  EXPECT_EQ(uuidOnDisk(after->url()), before->uuid().string());
  EXPECT_EQ(entries(replaceDirectory()), 0u);
  EXPECT_EQ(stagedItems(), 0u);
  // The transient container took the place.
  EXPECT_EQ(entries(classDirectory(VSAClass::kDataApplication, true)), 0u);
  // A new daemon finds the same container from disk.
  restart();
  after = lookup("com.example.app");
  ASSERT_TRUE(after);
  EXPECT_EQ(after->url(), before->url());
  EXPECT_EQ(after->uuid(), before->uuid());
}

TEST_F(ReplaceAndWipe, ARestrictedClientWipesOnlyListedPluginData) {
  VSAResultCode code;
  auto c = installer();
  for (auto [id, cls] :
       {std::pair<const char*, VSAContainerClass>{"com.example.listed", VSAClass::kDataPlugin},
        {"com.example.unlisted", VSAClass::kDataPlugin},
        {"com.example.listed", VSAClass::kDataApplication}}) {
    auto m = create(*c, id, &code, false, cls);
    ASSERT_TRUE(m) << code;
    put(m->url() + "/Documents/keep", id);
  }
  ASSERT_TRUE(create(*c, "com.example.bundle", &code, false, VSAClass::kBundleApplication));
  VSAValue list = VSAValue::array();
  list.append("com.example.listed");
  auto restricted = connection("com.example.settings", false, false, std::nullopt, list);
  EXPECT_EQ(wipe(*restricted, "com.example.unlisted", VSAClass::kDataPlugin),
            VSAResult::kNotEntitled);
  EXPECT_EQ(read(lookup("com.example.unlisted", VSAClass::kDataPlugin)->url() + "/Documents/keep"),
            "com.example.unlisted");
  EXPECT_EQ(wipe(*restricted, "com.example.listed", VSAClass::kDataApplication),
            VSAResult::kNotEntitled);
  EXPECT_EQ(
      read(lookup("com.example.listed", VSAClass::kDataApplication)->url() + "/Documents/keep"),
      "com.example.listed");
  EXPECT_EQ(wipe(*restricted, "com.example.listed", VSAClass::kDataPlugin), VSAResult::kSuccess);
  EXPECT_FALSE(
      fs::exists(lookup("com.example.listed", VSAClass::kDataPlugin)->url() + "/Documents/keep"));
  // Even an unrestricted client wipes data containers only, and existing ones.
  EXPECT_EQ(wipe(*c, "com.example.bundle", VSAClass::kBundleApplication),
            VSAResult::kInvalidArgument);
  EXPECT_EQ(wipe(*c, "com.example.never-made", VSAClass::kDataApplication),
            VSAResult::kContainerNotFound);
  EXPECT_EQ(entries(classDirectory(VSAClass::kDataApplication, true)), 0u);
}

// A crash between a wipe's renames left the old container in staging. The
// next start cannot move it back; its staging cleanup must keep it (and its
// replace file), and the start after that puts it back.
TEST_F(ReplaceAndWipe, AnOldContainerThatRecoveryCannotMoveBackWaitsForALaterStart) {
  VSAResultCode code;
  auto app = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(app) << code;
  put(app->url() + "/Documents/diary", "kept");
  std::string aside = staging() + "/" + VSAUUID::random().string();
  std::string fresh =
      classDirectory(VSAClass::kDataApplication, true) + "/" + VSAUUID::random().string();
  ASSERT_TRUE(VSAReplaceFile::_writeToDiskReplaceAt(
      *context_->fileManager, replaceDirectory() + "/" + VSAUUID::random().string() + ".plist",
      app->url(), fresh, aside, app->url(), nullptr));
  fs::create_directories(staging());
  fs::rename(app->url(), aside);

  context_.reset();
  startContext();
  faults_->failAll(VSAFileSystem::Op::Rename, EIO);
  installer()->keeperSetup();
  faults_->reset();
  std::promise<void> cleaned;
  installer()->keeperCleanupWithCompletion([&] { cleaned.set_value(); });
  cleaned.get_future().wait();
  EXPECT_EQ(read(aside + "/Documents/diary"), "kept");
  EXPECT_EQ(entries(replaceDirectory()), 1u);
  EXPECT_FALSE(fs::exists(app->url()));

  restart();
  auto back = lookup("com.example.app");
  ASSERT_TRUE(back);
  EXPECT_EQ(back->url(), app->url());
  EXPECT_EQ(back->uuid(), app->uuid());
  EXPECT_EQ(read(app->url() + "/Documents/diary"), "kept");
  EXPECT_EQ(entries(replaceDirectory()), 0u);
  EXPECT_EQ(stagedItems(), 0u);
}

TEST_F(ReplaceAndWipe, RecoveryActsOnlyOnValidReplaceFilesWhoseOldDirectoryIsGone) {
  auto& fm = *context_->fileManager;
  std::string base = root_ + "/scratch";
  for (const char* d : {"old-present", "staging-a", "staging-b", "staging-c", "staging-d"})
    fs::create_directories(base + "/" + d);
  put(base + "/staging-a/marker", "a");
  auto write = [&](const std::string& name, const VSAValue& dict) {
    auto bytes = VSAPlist::serialize(dict, VSAPlist::Format::Binary, nullptr);
    ASSERT_TRUE(bytes);
    ASSERT_TRUE(fm.writeFileAtomicallyAtURL(replaceDirectory() + "/" + name, *bytes, 0600,
                                            std::nullopt, nullptr));
  };
  auto file = [&](const std::string& old, const std::string& staging) {
    VSAValue d = VSAValue::dictionary();
    d.set(kVSAReplaceOperationOldURL, base + "/" + old);
    d.set(kVSAReplaceOperationNewURL, base + "/new");
    d.set(kVSAReplaceOperationStagingURL, base + "/" + staging);
    d.set(kVSAReplaceOperationDestURL, base + "/dest");
    return d;
  };
  write("1.plist", file("old-missing-a", "staging-a"));  // brought back
  write("2.plist", file("old-present", "staging-b"));    // nothing to do
  VSAValue noKey = file("old-missing-c", "staging-c");
  noKey.remove(kVSAReplaceOperationDestURL);
  write("3.plist", noKey);
  VSAValue notString = file("old-missing-d", "staging-d");
  notString.set(kVSAReplaceOperationNewURL, int64_t{7});
  write("4.plist", notString);
  VSAValue relative = file("old-missing-e", "staging-d");
  relative.set(kVSAReplaceOperationOldURL, "../old-missing-e");
  write("5.plist", relative);
  write("6.plist", VSAValue::array());
  put(replaceDirectory() + "/7.plist", "not a property list");

  VSATestLog log;
  ASSERT_TRUE(log.open(root_ + "/test.log"));
  installer()->keeperSetup();
  // Each valid file is shown with its dictionary of the four places.
  std::string shown = log.text();
  size_t line = shown.find("Doing a replace of " + replaceDirectory() + "/1.plist with info: ");
  ASSERT_NE(line, std::string::npos) << shown;
  std::string info = shown.substr(line, shown.find("Recovering from failed replace", line) - line);
  for (const char* key : {kVSAReplaceOperationOldURL, kVSAReplaceOperationNewURL,
                          kVSAReplaceOperationStagingURL, kVSAReplaceOperationDestURL})
    EXPECT_NE(info.find(key), std::string::npos) << key;
  EXPECT_EQ(read(base + "/old-missing-a/marker"), "a");
  EXPECT_FALSE(fs::exists(base + "/staging-a"));
  EXPECT_TRUE(fs::exists(base + "/staging-b"));
  for (const char* kept : {"staging-c", "staging-d", "old-present"})
    EXPECT_TRUE(fs::is_directory(base + "/" + kept)) << kept;
  for (const char* absent : {"old-missing-c", "old-missing-d", "old-missing-e"})
    EXPECT_FALSE(fs::exists(base + "/" + absent)) << absent;
  EXPECT_EQ(entries(replaceDirectory()), 0u);  // every file discarded
}

}  // namespace
