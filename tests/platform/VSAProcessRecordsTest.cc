// The launcher's process records: who reads as which app, and who never does.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "VSATestTempDir.h"
#include "platform/VSAProcessRecords.h"

namespace {

using Kind = VSAProcessRecordKind;

// A process running as `uid` that has started a child of its own; both
// wait to be killed. Exposes both pids.
struct Family {
  pid_t parent = -1, child = -1;
  explicit Family(uid_t uid) {
    int report[2];
    EXPECT_EQ(pipe(report), 0);
    parent = fork();
    if (parent == 0) {
      if (uid != 0 && (setgid(uid) != 0 || setuid(uid) != 0)) _exit(1);
      pid_t c = fork();
      if (c == 0) {
        pause();
        _exit(0);
      }
      (void)!write(report[1], &c, sizeof c);
      pause();
      _exit(0);
    }
    close(report[1]);
    EXPECT_EQ(read(report[0], &child, sizeof child), static_cast<ssize_t>(sizeof child));
    close(report[0]);
    // The child's uid is the parent's once the parent has dropped privileges.
    for (int i = 0; i < 100 && VSAAuditToken::processStat(child, true)->uid != uid; ++i)
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ~Family() {
    kill(child, SIGKILL);
    kill(parent, SIGKILL);
    waitpid(parent, nullptr, 0);
  }
  static uint64_t start(pid_t pid) { return VSAAuditToken::processStartTime(pid); }
};

TEST(VSAProcessRecords, ARecordNamesOneProcessOnlyWhileItIsRootsAndCurrent) {
  VSATestTempDir dir;
  VSAProcessRecords records{VSASystemRoot(dir.path())};
  pid_t self = getpid();
  uint64_t start = VSAAuditToken::processStartTime(self);
  EXPECT_EQ(records.write(Kind::SigningIdentifier, self, start, "com.example.app"), 0);
  EXPECT_EQ(records.read(Kind::SigningIdentifier, self, start), "com.example.app");
  EXPECT_FALSE(records.read(Kind::SigningIdentifier, self, start + 1)) << "a reused pid";
  EXPECT_FALSE(records.read(Kind::Persona, self, start)) << "kinds are apart";
  EXPECT_EQ(records.write(Kind::SigningIdentifier, self, start, "two words"), EINVAL);
  EXPECT_EQ(records.write(Kind::SigningIdentifier, self, start, ""), EINVAL);
  ASSERT_EQ(chown(records.path(Kind::SigningIdentifier, self).c_str(), 501, 501), 0);
  EXPECT_FALSE(records.read(Kind::SigningIdentifier, self, start)) << "not root's";
  std::ofstream(records.path(Kind::SigningIdentifier, self), std::ios::trunc)
      << start << " com.example.app extra\n";
  ASSERT_EQ(chown(records.path(Kind::SigningIdentifier, self).c_str(), 0, 0), 0);
  EXPECT_FALSE(records.read(Kind::SigningIdentifier, self, start)) << "malformed";
  records.remove(Kind::SigningIdentifier, self, start);
  EXPECT_TRUE(std::filesystem::exists(records.path(Kind::SigningIdentifier, self)))
      << "a record that is not this process's is left to its owner";
}

TEST(VSAProcessRecords, WhatAnAppStartsIsTheAppButOnlyUnderTheSameUser) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to start processes of another user";
  VSATestTempDir dir;
  VSAProcessRecords records{VSASystemRoot(dir.path())};
  {
    Family app(501);
    ASSERT_EQ(records.write(Kind::SigningIdentifier, app.parent, Family::start(app.parent),
                            "com.example.app"),
              0);
    EXPECT_EQ(records.readForProcessOrAncestor(Kind::SigningIdentifier, app.child,
                                               Family::start(app.child)),
              "com.example.app");
    EXPECT_FALSE(records.readForProcessOrAncestor(Kind::SigningIdentifier, app.child,
                                                  Family::start(app.child) + 1))
        << "the asking process must be the one named";
    // The parent gone, its child belongs to another process: no identity.
    kill(app.parent, SIGKILL);
    waitpid(app.parent, nullptr, 0);
    for (int i = 0; i < 100 && VSAAuditToken::processStat(app.child, false)->parent == app.parent;
         ++i)
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_FALSE(records.readForProcessOrAncestor(Kind::SigningIdentifier, app.child,
                                                  Family::start(app.child)));
  }
  {
    Family rooted(0);
    ASSERT_EQ(records.write(Kind::SigningIdentifier, rooted.parent, Family::start(rooted.parent),
                            "com.example.rootapp"),
              0);
    EXPECT_FALSE(records.readForProcessOrAncestor(Kind::SigningIdentifier, rooted.child,
                                                  Family::start(rooted.child)))
        << "root's processes are not followed up to a recorded ancestor";
  }
}

}  // namespace
