// A file system that forwards to another one and fails chosen calls.
//
// failNth(op, n, errno) makes the n-th call (counting from 1, from now on)
// of `op` fail with `errno` without reaching the real file system; failAll
// fails every call of `op`. Call counts per operation let a test enumerate
// the steps of an operation and fail each in turn. A descriptor-relative call
// counts as the operation of its path form (statAt as Lstat, unlinkAt as
// Unlink or Rmdir, renameAt as Rename, ...). readOnly() makes a layer that
// refuses every call that would change the disk (EROFS), for code that must
// only look, such as the root checker. afterNextLstatOf() runs a test's code
// at one exact point of an operation, to make a race with another thread
// happen every time.
//
// crashAfter(n, model) stops every call after the n-th, for crash-point
// sweeps, in one of two ways:
//   - ProcessDeath: every later call fails with EIO and changes nothing, as
//     if the process had died after its n-th call; what reached the disk
//     stays, synced or not.
//   - PowerLoss: the same, and at the moment of the crash (the call after
//     the n-th, or crashNow()) everything the calls since crashAfter() left
//     without making durable is undone on the real disk underneath, newest
//     first: renames not synced are renamed back, entries made in a
//     directory not synced since are removed with everything below them
//     (writeFile and copyDataAt sync a file's data, so only its entry can be
//     lost). What existed before crashAfter() counts as durable. VSAUnsyncedChanges holds the
//     rules: which call makes what durable, as VSAFileSystem promises; what is not modelled
//     (removals stay removed; attribute changes stay).
// Only what goes through this interface is seen: the code-signing database
// (SQLite syncs its own files) and run-time state under the run directory
// (written directly, and gone at a reboot anyway) are outside the model.
//
// Thread-safe. A call that is under way when the power fails is undone
// when it returns.
#pragma once

#include <array>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/VSAFileSystem.h"
#include "platform/VSAUnsyncedChanges.h"

class VSAFaultInjectingFileSystem : public VSAFileSystem {
 public:
  enum class CrashModel { ProcessDeath, PowerLoss };

  explicit VSAFaultInjectingFileSystem(std::shared_ptr<VSAFileSystem> inner);
  static std::shared_ptr<VSAFaultInjectingFileSystem> readOnly(
      std::shared_ptr<VSAFileSystem> inner);

  void failNth(Op op, int n, int error);
  void failAll(Op op, int error);
  // A simulated crash: the next `calls` calls of any kind go through, every
  // later one fails with EIO and changes nothing, as if the process had died
  // after its `calls`-th file-system call, or (PowerLoss) the device had
  // lost power then. reset() ends it.
  void crashAfter(int calls, CrashModel model = CrashModel::ProcessDeath);
  // The planned crash happens now, if it has not yet: for a power loss,
  // what the calls so far left unsynced is lost at once (an operation that
  // returned before its crash point, and the power failed after it).
  void crashNow();
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
  int readFileAt(int dir, const std::string& path, std::vector<uint8_t>* bytes,
                 size_t maxSize) override;
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
  int injectedLocked(Op op);  // the failures planned besides the crash

  struct Rule {
    Op op;
    int remaining;  // calls to let through first; -1: fail every call
    int error;
  };
  std::shared_ptr<VSAFileSystem> inner_;
  VSAUnsyncedChanges unsynced_;  // tracking only while a power loss is planned
  mutable std::mutex mutex_;
  std::array<int, static_cast<size_t>(Op::Count)> counts_{};
  std::vector<Rule> rules_;
  std::vector<std::pair<std::string, std::function<void()>>> lstatHooks_;
  int crashRemaining_ = -1;  // -1: no crash planned
  CrashModel crashModel_ = CrashModel::ProcessDeath;
  bool powerLost_ = false;
  int failCallRemaining_ = -1;  // -1: no single failure planned
  int failCallError_ = 0;
};
