// The Linux file system: POSIX calls, extended attributes, inode flags,
// libacl and copy_file_range/FICLONE.
//
// The data-protection class of an item is the extended attribute
// "trusted.vessa.protection-class" (decimal text); the device's lock state,
// asked through `isLocked`, guards class changes of items of class 1-3.
#pragma once

#include <functional>

#include "platform/VSAFileSystem.h"

inline constexpr const char* kVSAProtectionClassXattr = "trusted.vessa.protection-class";

class VSALinuxFileSystem : public VSAFileSystem {
 public:
  explicit VSALinuxFileSystem(std::function<bool()> isLocked = [] { return false; });

  int lstat(const std::string& path, struct stat* st) override;
  int mkdir(const std::string& path, mode_t mode) override;
  int lchown(const std::string& path, uid_t uid, gid_t gid) override;
  int chmod(const std::string& path, mode_t mode) override;
  int rename(const std::string& from, const std::string& to) override;
  int readlink(const std::string& path, std::string* target) override;
  int realpath(const std::string& path, std::string* resolved) override;
  int unlink(const std::string& path) override;
  int rmdir(const std::string& path) override;
  int readDirectory(const std::string& path, std::vector<VSADirectoryEntry>* entries) override;
  int getxattr(const std::string& path, const std::string& name, std::string* value) override;
  int setxattr(const std::string& path, const std::string& name, const std::string& value) override;
  int listxattr(const std::string& path, std::vector<std::string>* names) override;
  int getFlags(const std::string& path, int* flags) override;
  int setFlags(const std::string& path, int flags) override;
  int copyData(const std::string& from, const std::string& to, mode_t mode) override;
  int symlink(const std::string& target, const std::string& path) override;
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

 private:
  std::function<bool()> isLocked_;
};
