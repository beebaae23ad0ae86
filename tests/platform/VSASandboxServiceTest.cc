#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "VSATestTempDir.h"
#include "platform/VSASandboxService.h"

namespace {

TEST(VSASandboxService, ContainerTableOutlivesTheService) {
  VSATestTempDir temp("vessa-sandbox");
  {
    VSASandboxService sandbox{VSASystemRoot(temp.path())};
    ASSERT_EQ(sandbox.setUserStateItem(501, *VSASandboxItemTypeForClass(2), "com.app", 2, 1000,
                                       std::string("/c/A")),
              0);
    ASSERT_EQ(sandbox.setUserStateItem(501, *VSASandboxItemTypeForClass(7), "group.g", 7, 1000,
                                       std::string("/c/G")),
              0);
    // Replacing the same identifier and class keeps one item.
    ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", 2, 1000, std::string("/c/B")), 0);
  }
  VSASandboxService reopened{VSASystemRoot(temp.path())};
  std::vector<VSASandboxItem> items;
  reopened.iterateUserStateItems(501, [&](const VSASandboxItem& i) {
    items.push_back(i);
    return true;
  });
  ASSERT_EQ(items.size(), 2u);
  EXPECT_EQ(items[1].path, "/c/B");
  ASSERT_EQ(reopened.setUserStateItem(501, 1, "com.app", 2, 1000, std::nullopt), 0) << "removal";
  int count = 0;
  reopened.iterateUserStateItems(501, [&](const VSASandboxItem&) { return ++count, true; });
  EXPECT_EQ(count, 1);
  reopened.iterateUserStateItems(502, [&](const VSASandboxItem&) { return ADD_FAILURE(), true; });
  EXPECT_FALSE(VSASandboxItemTypeForClass(1)) << "bundle containers are not sandbox items";
  EXPECT_EQ(*VSASandboxItemTypeForClass(13), 9u);
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
