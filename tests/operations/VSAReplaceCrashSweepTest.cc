// Crash-point sweeps of the content wipe and of replace: the operation is
// stopped after its n-th file-system call (every later call fails and
// changes nothing, as if the process had died), a new daemon context starts
// on the same root and runs the setup and cleanup of every start, and the
// root must then hold every container whole, exactly once, as the cache
// says - for every n up to the number of calls of an uninterrupted run.
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "VSAContainerTestRoot.h"
#include "operations/VSADeathRow.h"

namespace fs = std::filesystem;

namespace {

class ReplaceCrashSweep : public VSAContainerTestRoot {
 protected:
  static void put(const std::string& path, const std::string& text) { std::ofstream(path) << text; }
  static std::string read(const std::string& path) {
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
  VSAMetadataRef lookup(const std::string& id) {
    VSAResultCode code = VSAResult::kSuccess;
    return installer()->createOrLookupContainerWithContainerIdentity(identity(id), false, false,
                                                                     true, &code);
  }
  std::string replaceDirectory() { return context_->globalConfiguration->replaceDirectory(); }
  // Waits for death-row work the crashed context queued, so that it cannot
  // run into the next context's checks.
  static void drainBackground() {
    VSADeathRow::_sharedBackgroundQueue()->sync([] {});
  }
  // How many file-system calls `run` makes when nothing stops it.
  template <typename Run>
  int countCalls(Run run) {
    faults_->reset();
    run();
    int calls = faults_->totalCalls();
    drainBackground();
    faults_->reset();
    return calls;
  }
  // Transient containers left by a crashed wipe go, as at a device boot, so
  // that every run starts from the same disk and makes the same calls.
  void rebootCleanup() {
    std::promise<void> done;
    installer()->rebootKeeperCleanupWithCompletion([&] { done.set_value(); });
    done.get_future().wait();
    emptyDeathRow();
  }
  // What every start must leave: no journal, nothing in staging.
  void expectNoLeftovers() {
    EXPECT_EQ(entries(replaceDirectory()), 0u);
    EXPECT_EQ(entries(staging(2)), 0u);
    if (entries(staging(2)))
      for (const auto& e : fs::directory_iterator(staging(2))) ADD_FAILURE() << "staged: " << e.path();
  }
};

TEST_F(ReplaceCrashSweep, ACrashAnywhereInAWipeLeavesTheOldOrTheWipedContainer) {
  VSAResultCode code;
  auto made = create(*installer(), "com.example.app", &code);
  ASSERT_TRUE(made) << code;
  const std::string url = made->url();
  const VSAUUID uuid = made->uuid();
  auto wipe = [&] {
    VSAResultCode result = VSAResult::kSuccess;
    installer()->deleteDataContainerContentWithContainerIdentity(identity("com.example.app"),
                                                                 &result);
    return result;
  };
  rebootCleanup();
  int total = countCalls([&] { ASSERT_EQ(wipe(), VSAResult::kSuccess); });
  ASSERT_GT(total, 20);
  int kept = 0, wiped = 0, broughtBack = 0;
  const std::string journals = replaceDirectory();  // asked before any crash
  for (int n = 1; n <= total; ++n) {
    SCOPED_TRACE("crash after call " + std::to_string(n));
    rebootCleanup();
    std::string file = url + "/Documents/data-" + std::to_string(n);
    put(file, "precious");
    faults_->reset();
    faults_->crashAfter(n);
    wipe();
    drainBackground();
    // Between the two renames the old container is in staging only.
    if (!fs::exists(url) && entries(journals) > 0) ++broughtBack;
    restart();
    ASSERT_TRUE(fs::is_directory(url));
    bool old = read(file) == "precious";
    old ? ++kept : ++wiped;
    if (!old) {
      EXPECT_TRUE(fs::is_directory(url + "/Documents"));  // a fresh structure
    }
    EXPECT_EQ(entries(classDirectory()), 1u);  // never both, never neither
    auto found = lookup("com.example.app");
    ASSERT_TRUE(found);
    EXPECT_EQ(found->url(), url);
    EXPECT_EQ(found->uuid(), uuid);
    VSAErrorRef error;
    auto onDisk = VSAMetadata::readAndValidateMetadataAtUrl(
        url, user_, false, *context_->globalConfiguration, *context_->userIdentityCache, &error);
    ASSERT_TRUE(onDisk) << error;
    EXPECT_EQ(onDisk->uuid(), uuid);
    expectNoLeftovers();
    if (HasFailure()) break;
  }
  std::printf(
      "wipe crash sweep: %d crash points; old content kept %d, wiped %d, brought back "
      "from staging %d\n",
      total, kept, wiped, broughtBack);
  EXPECT_GT(kept, 0);
  EXPECT_GT(wiped, 0);
  EXPECT_GT(broughtBack, 0);
  RecordProperty("crash_points", total);
}

TEST_F(ReplaceCrashSweep, ACrashAnywhereInAReplaceLosesNeitherContainer) {
  auto c = installer();
  VSAResultCode code;
  auto replace = [&](const VSAMetadataRef& oldM, const VSAMetadataRef& newM) {
    VSAResultCode result = VSAResult::kSuccess;
    installer()->replaceContainerIdentity(oldM->containerIdentity(), newM->containerIdentity(),
                                          false, false, &result);
    return result;
  };
  auto first = create(*c, "com.example.old.0", &code);
  auto second = create(*c, "com.example.new.0", &code);
  ASSERT_TRUE(first && second) << code;
  int total = countCalls([&] { ASSERT_EQ(replace(first, second), 1u); });
  ASSERT_GT(total, 5);
  int replaced = 0, untouched = 0;
  for (int n = 1; n <= total; ++n) {
    SCOPED_TRACE("crash after call " + std::to_string(n));
    std::string a = "com.example.old." + std::to_string(n),
                b = "com.example.new." + std::to_string(n);
    auto oldM = create(*installer(), a, &code);
    auto newM = create(*installer(), b, &code);
    ASSERT_TRUE(oldM && newM) << code;
    put(oldM->url() + "/Documents/old", a);
    put(newM->url() + "/Documents/new", b);
    std::string dest = classDirectory() + "/" + newM->uuid().string();
    faults_->reset();
    faults_->crashAfter(n);
    replace(oldM, newM);
    restart();
    bool newAtDest = read(dest + "/Documents/new") == b;
    bool newWhereItWas = read(newM->url() + "/Documents/new") == b;
    EXPECT_NE(newAtDest, newWhereItWas);  // the new container exists exactly once
    auto foundNew = lookup(b);
    ASSERT_TRUE(foundNew);
    EXPECT_EQ(foundNew->url(), newAtDest ? dest : newM->url());
    // Until the new container stands at its destination the old one is
    // whole where it was; a start puts it back from staging if need be.
    bool oldThere = read(oldM->url() + "/Documents/old") == a;
    if (!newAtDest) {
      EXPECT_TRUE(oldThere);
    }
    auto foundOld = lookup(a);
    EXPECT_EQ(bool(foundOld), oldThere);
    newAtDest ? ++replaced : ++untouched;
    expectNoLeftovers();
    if (HasFailure()) break;
  }
  std::printf("replace crash sweep: %d crash points; replaced %d, untouched %d\n", total, replaced,
              untouched);
  EXPECT_GT(replaced, 0);
  EXPECT_GT(untouched, 0);
}

}  // namespace
