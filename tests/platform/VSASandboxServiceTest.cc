#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "VSATestTempDir.h"
#include "platform/VSASandboxService.h"

namespace {

TEST(VSASandboxService, ContainerTableOutlivesTheService) {
  VSATestTempDir temp("vessa-sandbox");
  {
    VSASandboxService sandbox{VSASystemRoot(temp.path())};
    ASSERT_EQ(
        sandbox.setUserStateItem(501, *VSASandboxItemTypeForClass(VSAClass::kDataApplication),
                                 "com.app", VSAClass::kDataApplication, 1000, std::string("/c/A")),
        0);
    ASSERT_EQ(sandbox.setUserStateItem(501, *VSASandboxItemTypeForClass(VSAClass::kAppGroup),
                                       "group.g", VSAClass::kAppGroup, 1000, std::string("/c/G")),
              0);
    // Replacing the same identifier and class keeps one item.
    ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000,
                                       std::string("/c/B")),
              0);
  }
  VSASandboxService reopened{VSASystemRoot(temp.path())};
  std::vector<VSASandboxItem> items;
  reopened.iterateUserStateItems(501, [&](const VSASandboxItem& i) {
    items.push_back(i);
    return true;
  });
  ASSERT_EQ(items.size(), 2u);
  ASSERT_TRUE(reopened.userStateItem(501, "com.app", VSAClass::kDataApplication, 1000));
  EXPECT_EQ(reopened.userStateItem(501, "com.app", VSAClass::kDataApplication, 1000)->path, "/c/B");
  EXPECT_EQ(reopened.userStateItem(501, "group.g", VSAClass::kAppGroup, 1000)->path, "/c/G");
  EXPECT_FALSE(reopened.userStateItem(501, "com.app", VSAClass::kAppGroup, 1000))
      << "the class is part of the key";
  // Two personas of one uid keep their own items of the same identifier and class.
  ASSERT_EQ(reopened.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1001,
                                      std::string("/work/B")),
            0);
  EXPECT_EQ(reopened.userStateItem(501, "com.app", VSAClass::kDataApplication, 1000)->path, "/c/B");
  EXPECT_EQ(reopened.userStateItem(501, "com.app", VSAClass::kDataApplication, 1001)->path,
            "/work/B");
  ASSERT_EQ(
      reopened.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1001, std::nullopt),
      0);
  EXPECT_TRUE(reopened.userStateItem(501, "com.app", VSAClass::kDataApplication, 1000))
      << "the other persona's stays";
  ASSERT_EQ(
      reopened.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000, std::nullopt),
      0)
      << "removal";
  int count = 0;
  reopened.iterateUserStateItems(501, [&](const VSASandboxItem&) { return ++count, true; });
  EXPECT_EQ(count, 1);
  reopened.iterateUserStateItems(502, [&](const VSASandboxItem&) { return ADD_FAILURE(), true; });
  EXPECT_FALSE(VSASandboxItemTypeForClass(VSAClass::kBundleApplication))
      << "bundle containers are not sandbox items";
  EXPECT_EQ(*VSASandboxItemTypeForClass(VSAClass::kSystemGroup), 9u);
}

// Launches push the same mappings over and over: only a change (a new path
// or item type, an added or removed item) rewrites the table.
TEST(VSASandboxService, OnlyChangesRewriteTheTable) {
  VSATestTempDir temp("vessa-sandbox");
  VSASandboxService sandbox{VSASystemRoot(temp.path())};
  const std::string table = temp.path() + "/run/vessad/sandbox/501.plist";
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/A")),
            0);
  sandbox.flush();
  ASSERT_TRUE(std::filesystem::exists(table));
  // The file is removed behind the service's back: it comes back only when
  // something changed.
  std::filesystem::remove(table);
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/A")),
            0);
  ASSERT_EQ(
      sandbox.setUserStateItem(501, 1, "com.gone", VSAClass::kDataApplication, 1000, std::nullopt),
      0);
  sandbox.flush();
  EXPECT_FALSE(std::filesystem::exists(table)) << "nothing changed";
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/B")),
            0);
  sandbox.flush();
  EXPECT_TRUE(std::filesystem::exists(table)) << "a new path";
  std::filesystem::remove(table);
  ASSERT_EQ(sandbox.setUserStateItem(501, 4, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/B")),
            0);
  sandbox.flush();
  EXPECT_TRUE(std::filesystem::exists(table)) << "a new item type";
  std::filesystem::remove(table);
  ASSERT_EQ(
      sandbox.setUserStateItem(501, 4, "com.app", VSAClass::kDataApplication, 1000, std::nullopt),
      0);
  sandbox.flush();
  ASSERT_TRUE(std::filesystem::exists(table)) << "a removal";
  EXPECT_FALSE(sandbox.userStateItem(501, "com.app", VSAClass::kDataApplication, 1000));
}

// The writer thread persists changes on its own, without a flush or the
// service going away, and a burst of changes ends in one consistent file.
TEST(VSASandboxService, WriterThreadPersistsBurstsWithoutAFlush) {
  VSATestTempDir temp("vessa-sandbox");
  VSASandboxService sandbox{VSASystemRoot(temp.path())};
  for (int i = 0; i < 500; ++i)
    ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app" + std::to_string(i),
                                       VSAClass::kDataApplication, 1000, "/c/" + std::to_string(i)),
              0);
  for (int i = 0; i < 250; ++i)
    ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app" + std::to_string(i),
                                       VSAClass::kDataApplication, 1000, std::nullopt),
              0);
  auto countOnDisk = [&] {
    // A second service reads the file afresh (and writes nothing).
    VSASandboxService reader{VSASystemRoot(temp.path())};
    int n = 0;
    reader.iterateUserStateItems(501, [&](const VSASandboxItem&) { return ++n, true; });
    return n;
  };
  auto waitFor = [&](int want) {
    int onDisk = 0;
    for (int i = 0; i < 300 && (onDisk = countOnDisk()) != want; ++i)
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    return onDisk;
  };
  EXPECT_EQ(waitFor(250), 250);
  // Only the first change of a burst wakes the writer: a change after that
  // write is the first of the next burst and is written too.
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.late", VSAClass::kDataApplication, 1000,
                                     std::string("/c/late")),
            0);
  EXPECT_EQ(waitFor(251), 251);
}

TEST(VSASandboxService, TokensVerifyOnlyForTheirClassPathAndProcess) {
  VSATestTempDir temp("vessa-sandbox");
  VSASandboxService sandbox{VSASystemRoot(temp.path())};
  VSAAuditToken me{getpid(), getuid(), getgid(), VSAAuditToken::processStartTime(getpid())};
  auto token = sandbox.issueFileExtension("com.tamsk.sandbox.container", "/c/A", me);
  ASSERT_TRUE(token);
  EXPECT_TRUE(sandbox.verifyFileExtension(*token, "com.tamsk.sandbox.container", "/c/A", me));
  EXPECT_FALSE(
      sandbox.verifyFileExtension(*token, "com.tamsk.sandbox.application-group", "/c/A", me));
  EXPECT_FALSE(sandbox.verifyFileExtension(*token, "com.tamsk.sandbox.container", "/c/B", me));
  VSAAuditToken other = me;
  other.startTime += 1;
  EXPECT_FALSE(sandbox.verifyFileExtension(*token, "com.tamsk.sandbox.container", "/c/A", other));
  std::string forged = *token;
  forged.back() = forged.back() == '0' ? '1' : '0';
  EXPECT_FALSE(sandbox.verifyFileExtension(forged, "com.tamsk.sandbox.container", "/c/A", me));
  // Another service on the same root (a restarted daemon) shares the boot key.
  VSASandboxService again{VSASystemRoot(temp.path())};
  EXPECT_TRUE(again.verifyFileExtension(*token, "com.tamsk.sandbox.container", "/c/A", me));
  struct stat st;
  ASSERT_EQ(stat((temp.path() + "/run/vessad/sandbox-token.key").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  // Another root has another key.
  VSATestTempDir otherRoot("vessa-sandbox");
  VSASandboxService elsewhere{VSASystemRoot(otherRoot.path())};
  EXPECT_FALSE(elsewhere.verifyFileExtension(*token, "com.tamsk.sandbox.container", "/c/A", me));
}

}  // namespace
