// A file system that forwards to another one and fails chosen calls.
//
// failNth(op, n, errno) makes the n-th call (counting from 1, from now on)
// of `op` fail with `errno` without reaching the real file system; failAll
// fails every call of `op`. Call counts per operation let a test enumerate
// the steps of an operation and fail each in turn. A descriptor-relative call
// counts as the operation of its path form (statAt as Lstat, unlinkAt as
// Unlink or Rmdir, renameAt as Rename, ...). crashAfter(n) stops every call
// after the n-th, for crash-point sweeps. readOnly() makes a layer that
// refuses every call that would change the disk (EROFS), for code that must
// only look, such as the root checker. afterNextLstatOf() runs a test's code
// at one exact point of an operation, to make a race with another thread
// happen every time. Thread-safe.
#pragma once

#include <array>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/VSAFileSystem.h"

class VSAFaultInjectingFileSystem : public VSAFileSystem {
 public:
  explicit VSAFaultInjectingFileSystem(std::shared_ptr<VSAFileSystem> inner);
  static std::shared_ptr<VSAFaultInjectingFileSystem> readOnly(
      std::shared_ptr<VSAFileSystem> inner);

  void failNth(Op op, int n, int error);
  void failAll(Op op, int error);
  // A simulated crash: the next `calls` calls of any kind go through, every
  // later one fails with EIO and changes nothing, as if the process had died
  // after its `calls`-th file-system call. reset() ends it.
  void crashAfter(int calls);
  // The n-th call from now, whatever its kind, fails with `error` (ENOSPC,
  // EIO, ...) and changes nothing; the calls after it go through.
  void failCall(int n, int error);
  // Runs `hook` once, on the calling thread, right after the next lstat of
  // exactly `path` (also through exists()) has returned, whether it failed
  // or not. The hook may use this file system. reset() drops unrun hooks.
  void afterNextLstatOf(const std::string& path, std::function<void()> hook);
  bool crashed() const;
  void reset();
  int callCount(Op op) const;
  int totalCalls() const;

  int lstat(const std::string& path, struct stat* st) override;
  int mkdir(const std::string& path, mode_t mode) override;
  int lchown(const std::string& path, uid_t uid, gid_t gid) override;
  int chmod(const std::string& path, mode_t mode) override;
  int rename(const std::string& from, const std::string& to) override;
  int exchange(const std::string& a, const std::string& b) override;  // counted as a rename
  int renameWithoutSync(const std::string& from, const std::string& to) override;  // likewise
  int readlink(const std::string& path, std::string* target) override;
  int realpath(const std::string& path, std::string* resolved) override;
  int unlink(const std::string& path) override;
  int rmdir(const std::string& path) override;
  int readDirectory(const std::string& path, std::vector<VSADirectoryEntry>* entries) override;
  int getxattr(const std::string& path, const std::string& name, std::string* value) override;
  int getFlags(const std::string& path, int* flags) override;
  int setFlags(const std::string& path, int flags) override;
  int writeFile(const std::string& path, const std::vector<uint8_t>& bytes, mode_t mode) override;
  int readFile(const std::string& path, std::vector<uint8_t>* bytes, size_t maxSize) override;
  int mkdtemp(const std::string& templ, std::string* path) override;
  int setSystemContainerACL(const std::string& path, VSASystemContainerACL kind,
                            gid_t gid) override;
  int getProtectionClass(const std::string& path, int* protectionClass) override;
  int setProtectionClass(const std::string& path, int protectionClass) override;
  int directoryStatistics(const std::string& path, uint64_t* bytes) override;
  int maintainDirectoryStatistics(const std::string& path) override;
  int openDirectory(const std::string& path, int* fd) override;
  int openDirectoryAt(int dir, const std::string& name, int* fd) override;
  int statAt(int dir, const std::string& name, struct stat* st) override;
  int readDirectoryAt(int dir, std::vector<VSADirectoryEntry>* entries) override;
  int mkdirAt(int dir, const std::string& name, mode_t mode) override;
  int unlinkAt(int dir, const std::string& name, bool directory) override;
  int renameAt(int fromDir, const std::string& fromName, int toDir,
               const std::string& toName) override;
  int chownAt(int dir, const std::string& name, uid_t uid, gid_t gid) override;
  int chmodAt(int dir, const std::string& name, mode_t mode) override;
  int getFlagsAt(int dir, const std::string& name, int* flags) override;
  int setFlagsAt(int dir, const std::string& name, int flags) override;
  int setSystemContainerACLAt(int dir, const std::string& name, VSASystemContainerACL kind,
                              gid_t gid) override;
  int getProtectionClassAt(int dir, const std::string& name, int* protectionClass) override;
  int setProtectionClassAt(int dir, const std::string& name, int protectionClass) override;
  int syncDirectory(int dir) override;
  int copyDataAt(int fromDir, const std::string& fromName, int toDir, const std::string& toName,
                 mode_t mode) override;
  int readlinkAt(int dir, const std::string& name, std::string* target) override;
  int symlinkAt(const std::string& target, int dir, const std::string& name) override;
  int listxattrAt(int dir, const std::string& name, std::vector<std::string>* names) override;
  int getxattrAt(int dir, const std::string& name, const std::string& attribute,
                 std::string* value) override;
  int setxattrAt(int dir, const std::string& name, const std::string& attribute,
                 const std::string& value) override;

 private:
  // Counts the call; answers the errno to fail it with, or 0 to forward it.
  int injected(Op op);

  struct Rule {
    Op op;
    int remaining;  // calls to let through first; -1: fail every call
    int error;
  };
  std::shared_ptr<VSAFileSystem> inner_;
  mutable std::mutex mutex_;
  std::array<int, static_cast<size_t>(Op::Count)> counts_{};
  std::vector<Rule> rules_;
  std::vector<std::pair<std::string, std::function<void()>>> lstatHooks_;
  int crashRemaining_ = -1;     // -1: no crash planned
  int failCallRemaining_ = -1;  // -1: no single failure planned
  int failCallError_ = 0;
};
