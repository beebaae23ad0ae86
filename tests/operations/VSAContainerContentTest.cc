// Content named by client paths: the user-managed assets directory, asset
// deletion through death row, shared content staged from the bundle into
// the data container (whole or not at all, also across crashes), and the
// crash-retry journal.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "VSAContainerTestRoot.h"
#include "base/VSAPathString.h"
#include "operations/VSADeathRow.h"
#include "operations/VSARetryTest.h"

namespace fs = std::filesystem;

namespace {

class ContainerContent : public VSAContainerTestRoot {
 protected:
  struct Assets {
    std::optional<std::string> path;
    bool existed = false;
    VSAResultCode code = VSAResult::kSuccess;
  };
  Assets assets(VSAClientConnection& c, const std::string& id, bool relative, bool create) {
    Assets a;
    a.path = c.userManagedAssetsPathWithContainerIdentity(identity(id), relative, create,
                                                          &a.existed, &a.code);
    return a;
  }
  VSAResultCode deleteAsset(VSAClientConnection& c, const std::string& id,
                            const std::string& path) {
    VSAResultCode code = VSAResult::kSuccess;
    c.deleteUserManagedAssetWithContainerIdentity(identity(id), path, &code);
    return code;
  }
  VSAResultCode stageContent(VSAClientConnection& c, const std::string& id, const std::string& src,
                             const std::string& dst, std::string* landed = nullptr) {
    VSAResultCode code = VSAResult::kSuccess;
    auto path = c.stageSharedContentForIdentifier(id, user_, src, dst, &code);
    if (path && landed) *landed = *path;
    return code;
  }
  // A bundle container with shared content, and its data container.
  std::pair<VSAMetadataRef, VSAMetadataRef> app(const std::string& id) {
    VSAResultCode code;
    auto bundle = create(*installer(), id, &code, false, VSAClass::kBundleApplication);
    auto data = create(*installer(), id, &code, false, VSAClass::kDataApplication);
    EXPECT_TRUE(bundle && data) << code;
    fs::create_directories(bundle->url() + "/Shared/fonts");
    put(bundle->url() + "/Shared/fonts/a.ttf", "font-a");
    put(bundle->url() + "/Shared/fonts/b.ttf", "font-b");
    put(bundle->url() + "/Shared/readme", "hello");
    return {bundle, data};
  }
  std::string deathRow() { return context_->globalConfiguration->deathrowDirectory(); }
};

TEST_F(ContainerContent, TheAssetsDirectoryIsMadeOnceRecordedAndOwnedByTheContainer) {
  VSAResultCode code;
  auto data = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(data) << code;
  auto app = connection("com.example.app", false, false);
  // Not asked to create: the path it would have, nothing made.
  auto probe = assets(*app, "com.example.app", true, false);
  ASSERT_EQ(probe.code, VSAResult::kSuccess);
  EXPECT_EQ(*probe.path, "UserManagedAssets");
  EXPECT_FALSE(probe.existed);
  EXPECT_FALSE(fs::exists(data->url() + "/UserManagedAssets"));

  auto first = assets(*app, "com.example.app", false, true);
  ASSERT_EQ(first.code, VSAResult::kSuccess);
  EXPECT_FALSE(first.existed);
  EXPECT_EQ(*first.path, data->url() + "/UserManagedAssets");
  struct stat st {};
  ASSERT_EQ(::stat(first.path->c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0755u);
  EXPECT_EQ(st.st_uid, user_->posixUIDForContainerClass(VSAClass::kDataApplication));
  auto second = assets(*app, "com.example.app", true, true);
  EXPECT_TRUE(second.existed);
  EXPECT_EQ(*second.path, "UserManagedAssets");
  // The metadata file names it, so it survives a restart.
  restart();
  app = connection("com.example.app", false, false);  // the old one served the old context
  VSAErrorRef error;
  auto onDisk = VSAMetadata::readAndValidateMetadataAtUrl(data->url(), user_, false,
                                                          *context_->globalConfiguration,
                                                          *context_->userIdentityCache, &error);
  ASSERT_TRUE(onDisk) << error;
  EXPECT_EQ(onDisk->userManagedAssetsDirName().value_or(""), "UserManagedAssets");

  // Something else in its place is refused, not adopted; no container is 21;
  // another app's container is 55.
  auto other = create(*installer(), "com.example.other", &code);
  ASSERT_TRUE(other);
  fs::create_symlink("/etc", other->url() + "/UserManagedAssets");
  EXPECT_EQ(assets(*installer(), "com.example.other", false, true).code,
            VSAResult::kInvalidArgument);
  EXPECT_EQ(assets(*installer(), "com.example.none", false, true).code,
            VSAResult::kContainerNotFound);
  EXPECT_EQ(assets(*app, "com.example.other", false, true).code, VSAResult::kNotEntitled);
}

TEST_F(ContainerContent, DeletingAnAssetMovesOnlyThatAssetToDeathRow) {
  VSAResultCode code;
  auto data = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(data) << code;
  auto c = installer();
  auto dir = assets(*c, "com.example.app", false, true).path.value();
  fs::create_directories(dir + "/album");
  put(dir + "/album/photo", "pixels");
  put(dir + "/note", "n");
  put(data->url() + "/Documents/precious", "p");
  fs::create_symlink("../Documents", dir + "/escape");
  fs::create_symlink("album", dir + "/inside");

  for (const std::string& hostile :
       {std::string(".."), std::string("../Documents/precious"), std::string("/etc/passwd"),
        std::string(""), std::string("album/../note"), std::string("note\0x", 6),
        std::string("escape/precious"), std::string("inside/photo"), std::string("album/"),
        std::string(".")}) {
    SCOPED_TRACE(VSAClientStringForLog(hostile));
    EXPECT_EQ(deleteAsset(*c, "com.example.app", hostile), VSAResult::kInvalidArgument);
  }
  EXPECT_EQ(read(data->url() + "/Documents/precious"), "p");
  EXPECT_EQ(read(dir + "/album/photo"), "pixels");

  // A link named goes itself; what it points to stays.
  EXPECT_EQ(deleteAsset(*c, "com.example.app", "escape"), VSAResult::kSuccess);
  EXPECT_FALSE(fs::is_symlink(dir + "/escape"));
  EXPECT_EQ(read(data->url() + "/Documents/precious"), "p");
  EXPECT_EQ(deleteAsset(*c, "com.example.app", "album/photo"), VSAResult::kSuccess);
  EXPECT_FALSE(fs::exists(dir + "/album/photo"));
  EXPECT_EQ(deleteAsset(*c, "com.example.app", "album"), VSAResult::kSuccess);
  EXPECT_FALSE(fs::exists(dir + "/album"));
  EXPECT_EQ(deleteAsset(*c, "com.example.app", "album"), VSAResult::kSuccess);  // already gone
  EXPECT_TRUE(fs::exists(dir + "/note"));
  EXPECT_TRUE(fs::is_directory(dir));
  context_->backgroundQueue->sync([] {});
  EXPECT_EQ(emptyDeathRow(), VSAResult::kSuccess);
  EXPECT_EQ(entries(deathRow()), 0u);
}

TEST_F(ContainerContent, SharedContentLandsWholeFromTheBundleIntoTheDataContainer) {
  auto [bundle, data] = app("com.example.app");
  auto c = installer();
  std::string landed;
  ASSERT_EQ(stageContent(*c, "com.example.app", "Shared/fonts", "Library/Fonts", &landed),
            VSAResult::kSuccess);
  EXPECT_EQ(landed, data->url() + "/Library/Fonts");
  EXPECT_EQ(read(landed + "/a.ttf"), "font-a");
  EXPECT_EQ(read(landed + "/b.ttf"), "font-b");
  struct stat st {};
  ASSERT_EQ(::lstat((landed + "/a.ttf").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, user_->posixUIDForContainerClass(VSAClass::kDataApplication));
  // Staging again replaces the directory whole; a file is replaced by a file.
  put(bundle->url() + "/Shared/fonts/a.ttf", "font-a2");
  fs::remove(bundle->url() + "/Shared/fonts/b.ttf");
  ASSERT_EQ(stageContent(*c, "com.example.app", "Shared/fonts", "Library/Fonts"),
            VSAResult::kSuccess);
  EXPECT_EQ(read(landed + "/a.ttf"), "font-a2");
  EXPECT_FALSE(fs::exists(landed + "/b.ttf"));
  ASSERT_EQ(stageContent(*c, "com.example.app", "Shared/readme", "Documents/readme"),
            VSAResult::kSuccess);
  EXPECT_EQ(read(data->url() + "/Documents/readme"), "hello");
  EXPECT_EQ(entries(staging(VSAClass::kDataApplication)), 0u);

  // Hostile paths on either side; a source that is not there; a failing copy.
  fs::create_symlink("/etc", bundle->url() + "/Shared/out");
  for (auto [src, dst] :
       std::vector<std::pair<std::string, std::string>>{{"../../", "x"},
                                                        {"/etc/passwd", "x"},
                                                        {"Shared/out/passwd", "x"},
                                                        {"Shared/readme", ""},
                                                        {"Shared/readme", "../escape"},
                                                        {"Shared/readme", "/tmp/x"},
                                                        {"Shared/missing", "x"}}) {
    SCOPED_TRACE(src + " -> " + dst);
    EXPECT_EQ(stageContent(*c, "com.example.app", src, dst), VSAResult::kInvalidArgument);
  }
  faults_->failNth(VSAFileSystem::Op::Rename, 1, EIO);
  EXPECT_NE(stageContent(*c, "com.example.app", "Shared/readme", "Documents/second"),
            VSAResult::kSuccess);
  faults_->reset();
  EXPECT_FALSE(fs::exists(data->url() + "/Documents/second"));
  EXPECT_EQ(entries(staging(VSAClass::kDataApplication)), 0u);
  // An app may stage only its own content; an identifier without a bundle is 21.
  EXPECT_EQ(stageContent(*connection("com.example.evil", false, false), "com.example.app",
                         "Shared/readme", "x"),
            VSAResult::kNotEntitled);
  EXPECT_EQ(stageContent(*c, "com.example.none", "Shared/readme", "x"),
            VSAResult::kContainerNotFound);
}

TEST_F(ContainerContent, ACrashWhileStagingLeavesTheOldOrTheNewContentNeverAMix) {
  auto [bundle, data] = app("com.example.app");
  const std::string landed = data->url() + "/Library/Fonts";
  auto stageFonts = [&] {
    return stageContent(*installer(), "com.example.app", "Shared/fonts", "Library/Fonts");
  };
  ASSERT_EQ(stageFonts(), VSAResult::kSuccess);
  put(bundle->url() + "/Shared/fonts/a.ttf", "font-a2");
  put(bundle->url() + "/Shared/fonts/b.ttf", "font-b2");
  restart();  // every run below starts from a fresh context
  faults_->reset();
  ASSERT_EQ(stageFonts(), VSAResult::kSuccess);
  int total = faults_->totalCalls();
  ASSERT_GT(total, 5);
  // As if the process died after call n, then as if the device lost power
  // there (what was not synced is undone; after the last call, the power
  // fails once the reply is out, and the new content must be there).
  using CrashModel = VSAFaultInjectingFileSystem::CrashModel;
  for (CrashModel model : {CrashModel::ProcessDeath, CrashModel::PowerLoss}) {
    const char* name = model == CrashModel::PowerLoss ? "power loss" : "process death";
    int oldSeen = 0, newSeen = 0, absent = 0;
    for (int n = 1; n <= total; ++n) {
      SCOPED_TRACE(std::string(name) + ": crash after call " + std::to_string(n));
      fs::remove_all(landed);
      fs::copy(bundle->url() + "/Shared/fonts", landed);
      put(landed + "/a.ttf", "font-a");
      put(landed + "/b.ttf", "font-b");
      faults_->reset();
      faults_->crashAfter(n, model);
      VSAResultCode code = stageFonts();
      context_->backgroundQueue->sync([] {});
      faults_->crashNow();
      restart();
      std::string a = read(landed + "/a.ttf"), b = read(landed + "/b.ttf");
      if (!fs::exists(landed)) {
        ++absent;
      } else if (a == "font-a") {
        EXPECT_EQ(b, "font-b");
        EXPECT_NE(code, VSAResult::kSuccess) << "staged content reported done was lost";
        ++oldSeen;
      } else {
        EXPECT_EQ(a, "font-a2");
        EXPECT_EQ(b, "font-b2");
        ++newSeen;
      }
      EXPECT_EQ(entries(staging(VSAClass::kDataApplication)), 0u);
      if (HasFailure()) break;
    }
    std::printf("stage crash sweep (%s): %d points; old %d, new %d, missing %d\n", name, total,
                oldSeen, newSeen, absent);
    EXPECT_EQ(absent, 0);  // the exchange never leaves the destination empty
    EXPECT_GT(oldSeen, 0);
    EXPECT_GT(newSeen, 0);
    if (HasFailure()) return;
  }
}

struct Crashed {
  std::string message;
};

TEST_F(ContainerContent, TheRetryTestCountsItsCrashesAcrossStarts) {
  const auto& services = *context_->operationServices;
  auto crash = [](const std::string& message) { throw Crashed{message}; };
  VSARetryTest retry(services, crash);
  VSAResultCode code = VSAResult::kSuccess;
  EXPECT_FALSE(retry.retryTestWithNumCrashes(kVSAMaxRetryCrashes + 1, &code));
  EXPECT_EQ(code, VSAResult::kOutOfRange);
  code = VSAResult::kSuccess;
  EXPECT_TRUE(retry.retryTestWithNumCrashes(0, &code));  // nothing to crash for
  EXPECT_FALSE(retry.readJournal(&code));

  EXPECT_THROW((void)retry.retryTestWithNumCrashes(2, &code), Crashed);
  auto journal = retry.readJournal(&code);
  ASSERT_TRUE(journal);
  EXPECT_EQ(journal->numRetryCrashes, 2u);
  EXPECT_EQ(journal->crashesLeft, 1u);  // counted before it crashed
  EXPECT_THROW((void)VSARetryTest(services, crash).resumeRetryTestIfPending(&code), Crashed);
  EXPECT_EQ(retry.readJournal(&code)->crashesLeft, 0u);
  EXPECT_TRUE(VSARetryTest(services, crash).resumeRetryTestIfPending(&code));
  EXPECT_FALSE(retry.readJournal(&code));
  EXPECT_TRUE(VSARetryTest(services, crash).resumeRetryTestIfPending(&code));  // none pending

  // A journal that is not one is dropped, never acted on.
  std::string path = context_->globalConfiguration->libraryDirectory() + "/RetryTest.plist";
  for (const std::string& bad : {std::string("garbage"), std::string(8192, 'x')}) {
    put(path, bad);
    code = VSAResult::kSuccess;
    EXPECT_FALSE(VSARetryTest(services, crash).resumeRetryTestIfPending(&code));
    EXPECT_EQ(code, VSAResult::kInvalidReplaceFile);
    EXPECT_FALSE(fs::exists(path));
  }
}

}  // namespace

// A move into death row makes a fresh directory, then renames the item into
// it: an emptying that listed the directory still empty sees the item arrive
// while it removes. The entry is removed whole, not moved aside to /tmp.
TEST_F(ContainerContent, ADeathRowEntryThatGainsItsItemWhileRemovedIsRemovedNotMovedAside) {
  std::string entry = deathRow() + "/temp.abcdef";
  fs::create_directories(entry);
  put(entry + "/first", "x");
  bool arrived = false;
  auto itemArrives = [&](uint64_t) {
    if (arrived) return;
    arrived = true;
    fs::create_directories(entry + "/container/Documents");
    put(entry + "/container/Documents/file", "y");
  };
  VSAErrorRef error;
  EXPECT_TRUE(context_->deathRow->_removeItemOrMoveToTempAtURL(entry, &error, itemArrives));
  EXPECT_TRUE(arrived);
  EXPECT_FALSE(fs::exists(entry));
  EXPECT_TRUE(VSADeathRow::leftoversInTemp(*context_->globalConfiguration).empty())
      << "nothing was moved aside";
}
