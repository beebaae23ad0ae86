#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
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

// What the files of a table hold, in bytes (the table and its log).
uint64_t writtenBytes(const std::string& root, uid_t uid) {
  uint64_t n = 0;
  for (const char* suffix : {".plist", ".log"}) {
    std::string f = root + "/run/vessad/sandbox/" + std::to_string(uid) + suffix;
    if (std::filesystem::exists(f)) n += std::filesystem::file_size(f);
  }
  return n;
}

// Launches push the same mappings over and over: only a change (a new path
// or item type, an added or removed item) is written.
TEST(VSASandboxService, OnlyChangesAreWritten) {
  VSATestTempDir temp("vessa-sandbox");
  VSASandboxService sandbox{VSASystemRoot(temp.path())};
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/A")),
            0);
  sandbox.flush();
  uint64_t written = writtenBytes(temp.path(), 501);
  ASSERT_GT(written, 0u);
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/A")),
            0);
  ASSERT_EQ(
      sandbox.setUserStateItem(501, 1, "com.gone", VSAClass::kDataApplication, 1000, std::nullopt),
      0);
  sandbox.flush();
  EXPECT_EQ(writtenBytes(temp.path(), 501), written) << "nothing changed";
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/B")),
            0);
  sandbox.flush();
  EXPECT_GT(writtenBytes(temp.path(), 501), written) << "a new path";
  written = writtenBytes(temp.path(), 501);
  ASSERT_EQ(sandbox.setUserStateItem(501, 4, "com.app", VSAClass::kDataApplication, 1000,
                                     std::string("/c/B")),
            0);
  sandbox.flush();
  EXPECT_GT(writtenBytes(temp.path(), 501), written) << "a new item type";
  written = writtenBytes(temp.path(), 501);
  ASSERT_EQ(
      sandbox.setUserStateItem(501, 4, "com.app", VSAClass::kDataApplication, 1000, std::nullopt),
      0);
  sandbox.flush();
  EXPECT_GT(writtenBytes(temp.path(), 501), written) << "a removal";
  EXPECT_FALSE(sandbox.userStateItem(501, "com.app", VSAClass::kDataApplication, 1000));
  VSASandboxService reopened{VSASystemRoot(temp.path())};
  EXPECT_FALSE(reopened.userStateItem(501, "com.app", VSAClass::kDataApplication, 1000));
}

// Stores com.app0 ... com.app<n-1> for uid 501, at /c/0 ... /c/<n-1>.
void fill(VSASandboxService& sandbox, int n) {
  for (int i = 0; i < n; ++i)
    ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app" + std::to_string(i),
                                       VSAClass::kDataApplication, 1000, "/c/" + std::to_string(i)),
              0);
}

// Every item of `uid` as "identifier=path", sorted.
std::vector<std::string> itemsOf(VSASandboxService& sandbox, uid_t uid) {
  std::vector<std::string> out;
  sandbox.iterateUserStateItems(uid, [&](const VSASandboxItem& i) {
    out.push_back(i.identifier + "=" + i.path);
    return true;
  });
  std::sort(out.begin(), out.end());
  return out;
}

// A large table: a change is appended to the log (the table file is not
// touched); once the log outgrows the table, the table is written whole
// and the log starts again; a service reading the files afresh sees what
// the writing one holds at every step.
TEST(VSASandboxService, ChangesGoToTheLogUntilItOutgrowsTheTable) {
  VSATestTempDir temp("vessa-sandbox");
  const std::string table = temp.path() + "/run/vessad/sandbox/501.plist";
  const std::string log = temp.path() + "/run/vessad/sandbox/501.log";
  VSASandboxService sandbox{VSASystemRoot(temp.path())};
  ASSERT_NO_FATAL_FAILURE(fill(sandbox, 2000));
  sandbox.flush();
  ASSERT_TRUE(std::filesystem::exists(table)) << "a boot's burst is written whole";
  EXPECT_FALSE(std::filesystem::exists(log));
  const auto tableBytes = std::filesystem::file_size(table);
  const auto tableTime = std::filesystem::last_write_time(table);
  ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app7", VSAClass::kDataApplication, 1000,
                                     std::string("/moved")),
            0);
  ASSERT_EQ(
      sandbox.setUserStateItem(501, 1, "com.app8", VSAClass::kDataApplication, 1000, std::nullopt),
      0);
  sandbox.flush();
  ASSERT_TRUE(std::filesystem::exists(log));
  const auto perChange = std::filesystem::file_size(log) / 2;
  EXPECT_LT(perChange, 500u) << "a change costs its own bytes";
  EXPECT_EQ(std::filesystem::last_write_time(table), tableTime) << "the table is not rewritten";
  {
    VSASandboxService reader{VSASystemRoot(temp.path())};
    EXPECT_EQ(itemsOf(reader, 501), itemsOf(sandbox, 501));
  }
  // Changes one at a time until the log is larger than the table.
  int changes = 0;
  uintmax_t lastLogBytes = 0;
  while (std::filesystem::exists(log) && changes < 100000) {
    lastLogBytes = std::filesystem::file_size(log);
    ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app" + std::to_string(changes % 2000),
                                       VSAClass::kDataApplication, 1000,
                                       "/round/" + std::to_string(changes)),
              0);
    sandbox.flush();
    ++changes;
  }
  EXPECT_FALSE(std::filesystem::exists(log)) << "the log started again";
  EXPECT_GT(lastLogBytes, tableBytes)
      << "the table was written whole only after the log had outgrown it";
  EXPECT_LT(lastLogBytes, tableBytes + 2 * perChange) << "and then at once";
  VSASandboxService reader{VSASystemRoot(temp.path())};
  EXPECT_EQ(itemsOf(reader, 501), itemsOf(sandbox, 501));
  EXPECT_EQ(reader.userStateItem(501, "com.app0", VSAClass::kDataApplication, 1000)->path,
            "/round/0");
}

// A daemon can stop at any point of a write: a record cut short ends the
// log (the changes before it count), and a log left behind by a table that
// was written whole after it changes nothing (its changes are numbered at
// or below the table's).
TEST(VSASandboxService, ACutRecordEndsTheLogAndAnOldLogIsSkipped) {
  VSATestTempDir temp("vessa-sandbox");
  const std::string log = temp.path() + "/run/vessad/sandbox/501.log";
  {
    VSASandboxService sandbox{VSASystemRoot(temp.path())};
    ASSERT_NO_FATAL_FAILURE(fill(sandbox, 300));
    sandbox.flush();
    for (const char* path : {"/first", "/second", "/third"}) {
      ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.app1", VSAClass::kDataApplication, 1000,
                                         std::string(path)),
                0);
      sandbox.flush();
    }
  }
  std::filesystem::copy_file(log, log + ".old");
  std::filesystem::resize_file(log, std::filesystem::file_size(log) - 3);
  {
    VSASandboxService reopened{VSASystemRoot(temp.path())};
    ASSERT_TRUE(reopened.userStateItem(501, "com.app1", VSAClass::kDataApplication, 1000));
    EXPECT_EQ(reopened.userStateItem(501, "com.app1", VSAClass::kDataApplication, 1000)->path,
              "/second")
        << "the cut record is dropped, the ones before it count";
    // The next change cannot follow a cut record: the table is written whole.
    ASSERT_EQ(reopened.setUserStateItem(501, 1, "com.app1", VSAClass::kDataApplication, 1000,
                                        std::string("/fourth")),
              0);
    reopened.flush();
    EXPECT_FALSE(std::filesystem::exists(log));
  }
  // The old log comes back beside the newer table (a stop between writing
  // the table and removing the log): none of its changes is applied again.
  std::filesystem::rename(log + ".old", log);
  VSASandboxService again{VSASystemRoot(temp.path())};
  EXPECT_EQ(again.userStateItem(501, "com.app1", VSAClass::kDataApplication, 1000)->path,
            "/fourth");
  EXPECT_EQ(itemsOf(again, 501).size(), 300u);
}

// A table file that cannot be read is not taken for an empty table (whose
// changes, numbered from zero, a later read would skip), and a write that
// fails leaves the table changed: the next write puts it whole.
TEST(VSASandboxService, FilesThatCannotBeReadOrWrittenLoseNothing) {
  VSATestTempDir temp("vessa-sandbox");
  const std::string table = temp.path() + "/run/vessad/sandbox/501.plist";
  const std::string log = temp.path() + "/run/vessad/sandbox/501.log";
  {
    VSASandboxService sandbox{VSASystemRoot(temp.path())};
    ASSERT_NO_FATAL_FAILURE(fill(sandbox, 300));
  }
  ASSERT_TRUE(std::filesystem::exists(table));
  std::filesystem::rename(table, table + ".kept");
  std::filesystem::create_directory(table);  // read: not a regular file
  {
    VSASandboxService sandbox{VSASystemRoot(temp.path())};
    EXPECT_FALSE(sandbox.userStateItem(501, "com.app1", VSAClass::kDataApplication, 1000));
    EXPECT_NE(sandbox.setUserStateItem(501, 1, "com.new", VSAClass::kDataApplication, 1000,
                                       std::string("/new")),
              0)
        << "a change to a table that could not be read is refused";
    std::filesystem::remove(table);
    std::filesystem::rename(table + ".kept", table);
    ASSERT_TRUE(sandbox.userStateItem(501, "com.app1", VSAClass::kDataApplication, 1000))
        << "read again once it can be";
    // The log cannot be appended to (a directory in its place).
    std::filesystem::create_directory(log);
    ASSERT_EQ(sandbox.setUserStateItem(501, 1, "com.new", VSAClass::kDataApplication, 1000,
                                       std::string("/new")),
              0);
    sandbox.flush();
    std::filesystem::remove(log);
    sandbox.flush();  // the failed table is still to be written
  }
  VSASandboxService reopened{VSASystemRoot(temp.path())};
  ASSERT_TRUE(reopened.userStateItem(501, "com.new", VSAClass::kDataApplication, 1000));
  EXPECT_EQ(itemsOf(reopened, 501).size(), 301u);
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
