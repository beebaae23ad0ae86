// The Linux file system: POSIX calls, extended attributes, inode flags,
// libacl and copy_file_range/FICLONE.
//
// A path is resolved by the kernel with openat2(RESOLVE_NO_SYMLINKS) up to its
// directory, and the call then acts on the last name relative to that
// directory: a link anywhere in the path is ELOOP. The system root is made
// canonical at start, so the only links met are ones planted below it.
// Calls with no descriptor form (extended attributes, ACLs) reach the item
// through /proc/self/fd of its directory, which does not re-resolve the path.
//
// The data-protection class of an item is the extended attribute
// "trusted.vessa.protection-class" (decimal text); the device's lock state,
// asked through `isLocked`, guards class changes of items of class 1-3.
#pragma once

#include <functional>

#include "platform/VSAFileSystem.h"
#include "platform/VSAUniqueFd.h"

inline constexpr const char* kVSAProtectionClassXattr = "trusted.vessa.protection-class";

class VSALinuxFileSystem : public VSAFileSystem {
 public:
  explicit VSALinuxFileSystem(std::function<bool()> isLocked = [] { return false; });

  int lstat(const std::string& path, struct stat* st) override;
  // One open of the item itself: two system calls where lstat takes three.
  int exists(const std::string& path) override;
  int mkdir(const std::string& path, mode_t mode) override;
  int lchown(const std::string& path, uid_t uid, gid_t gid) override;
  int chmod(const std::string& path, mode_t mode) override;
  int rename(const std::string& from, const std::string& to) override;
  int renameWithoutSync(const std::string& from, const std::string& to) override;
  int exchange(const std::string& a, const std::string& b) override;
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
  // Project quotas: a tree's statistics are its project's usage.
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

  // Opens `path` with `flags` (O_CLOEXEC added) without following a link
  // anywhere in it.
  static int openNoSymlinks(const std::string& path, int flags, VSAUniqueFd* fd);
  // Opens the directory holding `path` and names its last component.
  static int openParent(const std::string& path, VSAUniqueFd* dir, std::string* name);

 private:
  template <typename F>
  int atParent(const std::string& path, F&& call);
  // "/proc/self/fd/<dir>/<name>": the item by its directory's descriptor.
  static std::string procPath(int dir, const std::string& name);
  // Opens a regular file or directory for an ioctl; others are ENOTTY.
  static int openForIoctl(int dir, const std::string& name, VSAUniqueFd* fd);

  std::function<bool()> isLocked_;
};
