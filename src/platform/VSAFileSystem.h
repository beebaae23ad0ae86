// The file-system interface: every file-system call of the daemon goes
// through one of these, so that tests can inject failures (see
// VSAFaultInjectingFileSystem) and prove that a failure at any step loses
// nothing. Calls take host paths or a directory descriptor and one name, and
// return 0 or an errno. No call follows a symbolic link anywhere in a path
// (ELOOP), unless it says so: the daemon acts as root below directories that
// apps and users own, and a link swapped in for one of them must not send it
// elsewhere. Descriptor-relative calls ("...At") act on the directory they are
// given, wherever it has been moved since it was opened; a walk opens each
// directory once and acts on its entries by name. Implementations are
// thread-safe.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cerrno>
#include <cstdint>
#include <string>
#include <vector>

struct VSADirectoryEntry {
  std::string name;
  enum class Type { Directory, File, Symlink, Other } type = Type::Other;
  ino_t inode = 0;  // as the directory reports it (0 when unknown)
};

// The platform's names of the data-protection classes, as entitlements spell them.
inline constexpr const char* kVSAFileProtectionComplete = "VSAFileProtectionComplete";  // 1
inline constexpr const char* kVSAFileProtectionCompleteUnlessOpen =
    "VSAFileProtectionCompleteUnlessOpen";                                                // 2
inline constexpr const char* kVSAFileProtectionWriteOnly = "VSAFileProtectionWriteOnly";  // 2
inline constexpr const char* kVSAFileProtectionCompleteUntilFirstUserAuthentication =
    "VSAFileProtectionCompleteUntilFirstUserAuthentication";  // 3
inline constexpr const char* kVSAFileProtectionCompleteUntilUserAuthentication =
    "VSAFileProtectionCompleteUntilUserAuthentication";                         // 3
inline constexpr const char* kVSAFileProtectionNone = "VSAFileProtectionNone";  // 4

// The three ACLs of system containers (all granting the "systemusers" group).
enum class VSASystemContainerACL { TopLevel, Directory, File };

class VSAFileSystem {
 public:
  // Operation names, for failure injection.
  enum class Op {
    Lstat,
    Mkdir,
    Chown,
    Chmod,
    Rename,
    Readlink,
    Realpath,
    Unlink,
    Rmdir,
    ReadDirectory,
    GetXattr,
    SetXattr,
    ListXattr,
    GetFlags,
    SetFlags,
    CopyData,
    Symlink,
    WriteFile,
    ReadFile,
    Mkdtemp,
    SetACL,
    GetClass,
    SetClass,
    DirectoryStatistics,
    MaintainStatistics,
    OpenDirectory,
    SyncDirectory,
    Count
  };

  virtual ~VSAFileSystem() = default;

  virtual int lstat(const std::string& path, struct stat* st) = 0;
  // 0 when `path` names an item (a link counts and is not followed), else
  // the error lstat would give.
  virtual int exists(const std::string& path) {
    struct stat st;
    return lstat(path, &st);
  }
  virtual int mkdir(const std::string& path, mode_t mode) = 0;
  virtual int lchown(const std::string& path, uid_t uid, gid_t gid) = 0;
  // Changes the mode of a non-link item (links have no mode of their own).
  virtual int chmod(const std::string& path, mode_t mode) = 0;
  // A commit: renames, then syncs the destination's directory (the journal
  // carries the source directory's change in the same commit).
  virtual int rename(const std::string& from, const std::string& to) = 0;
  // A rename whose loss in a crash is harmless (it is redone): no sync.
  virtual int renameWithoutSync(const std::string& from, const std::string& to) = 0;
  // Swaps two existing items in one step, then syncs both directories.
  virtual int exchange(const std::string& a, const std::string& b) = 0;
  virtual int readlink(const std::string& path, std::string* target) = 0;
  virtual int realpath(const std::string& path, std::string* resolved) = 0;
  virtual int unlink(const std::string& path) = 0;
  virtual int rmdir(const std::string& path) = 0;
  // Every entry but "." and "..", with its type.
  virtual int readDirectory(const std::string& path, std::vector<VSADirectoryEntry>* entries) = 0;
  virtual int getxattr(const std::string& path, const std::string& name, std::string* value) = 0;
  // Inode flags (FS_IMMUTABLE_FL ...); ENOTTY/EOPNOTSUPP where unsupported.
  virtual int getFlags(const std::string& path, int* flags) = 0;
  virtual int setFlags(const std::string& path, int flags) = 0;
  // Creates or truncates `path` with `bytes` and syncs it.
  virtual int writeFile(const std::string& path, const std::vector<uint8_t>& bytes,
                        mode_t mode) = 0;
  // Reads regular file `path` whole, but never more than `maxSize` bytes:
  // opened O_RDONLY|O_NOFOLLOW|O_NONBLOCK|O_CLOEXEC (a FIFO in its place
  // cannot block the caller) and checked with fstat on the open descriptor.
  // Errors besides those of open/read: ELOOP for a symbolic link, ENXIO for
  // a socket, EINVAL for any other non-regular file, EFBIG for a file larger
  // than `maxSize` (refused by its size, without reading it). Every caller
  // names the limit of the kind of file it reads.
  virtual int readFile(const std::string& path, std::vector<uint8_t>* bytes, size_t maxSize) = 0;
  // `templ` ends in "XXXXXX"; the created directory's path comes back in `path`.
  virtual int mkdtemp(const std::string& templ, std::string* path) = 0;
  // Writes one of the system-container ACLs granting group `gid`; a link is
  // refused (ELOOP).
  virtual int setSystemContainerACL(const std::string& path, VSASystemContainerACL kind,
                                    gid_t gid) = 0;

  // Data-protection class of a file or directory (0 when none was set).
  // While the device is locked, changing the class of an item of class 1-3
  // fails with kDeviceLockedError.
  virtual int getProtectionClass(const std::string& path, int* protectionClass) = 0;
  virtual int setProtectionClass(const std::string& path, int protectionClass) = 0;

  // Directory statistics (fast sizing): the bytes used by the tree below
  // `path` as the file system accounts them, without walking it. Fails
  // (ENOTSUP, ESRCH, ...) where the file system keeps no such count.
  virtual int directoryStatistics(const std::string& path, uint64_t* bytes) = 0;
  // Asks the file system to keep statistics for the tree below `path` from now on.
  virtual int maintainDirectoryStatistics(const std::string& path) = 0;

  // --- Descriptor-relative calls. `dir` is a descriptor from openDirectory or
  // openDirectoryAt (the caller closes it); `name` is one component. Where a
  // call says so, an empty name stands for `dir` itself.

  // Opens a directory for reading and walking (O_DIRECTORY, no link anywhere
  // in `path`).
  virtual int openDirectory(const std::string& path, int* fd) = 0;
  virtual int openDirectoryAt(int dir, const std::string& name, int* fd) = 0;
  // Empty name: `dir` itself.
  virtual int statAt(int dir, const std::string& name, struct stat* st) = 0;
  virtual int readDirectoryAt(int dir, std::vector<VSADirectoryEntry>* entries) = 0;
  // readFile for `path` relative to `dir`, resolved beneath it (no "..",
  // no absolute path) with no symbolic link anywhere: the kernel walks only
  // the components below the open directory.
  virtual int readFileAt(int dir, const std::string& path, std::vector<uint8_t>* bytes,
                         size_t maxSize) = 0;
  virtual int mkdirAt(int dir, const std::string& name, mode_t mode) = 0;
  virtual int unlinkAt(int dir, const std::string& name, bool directory) = 0;
  // Renames entry `fromName` of `fromDir` to `toName` of `toDir`, never over
  // an existing item (EEXIST), then syncs `toDir` (a commit, as rename).
  virtual int renameAt(int fromDir, const std::string& fromName, int toDir,
                       const std::string& toName) = 0;
  // Empty name: `dir` itself. A link is changed itself (owner) or left alone (mode).
  virtual int chownAt(int dir, const std::string& name, uid_t uid, gid_t gid) = 0;
  virtual int chmodAt(int dir, const std::string& name, mode_t mode) = 0;
  // Inode flags of a regular file or directory (others: ENOTTY).
  virtual int getFlagsAt(int dir, const std::string& name, int* flags) = 0;
  virtual int setFlagsAt(int dir, const std::string& name, int flags) = 0;
  virtual int setSystemContainerACLAt(int dir, const std::string& name, VSASystemContainerACL kind,
                                      gid_t gid) = 0;
  virtual int getProtectionClassAt(int dir, const std::string& name, int* protectionClass) = 0;
  virtual int setProtectionClassAt(int dir, const std::string& name, int protectionClass) = 0;
  // Flushes a directory's entries to disk (the second half of a commit).
  virtual int syncDirectory(int dir) = 0;
  // Creates `toName` in `toDir` (it must not exist) with the data of regular
  // file `fromName` of `fromDir`, cloning extents where the file system can,
  // and syncs it (as writeFile: the data, not the directory entry).
  virtual int copyDataAt(int fromDir, const std::string& fromName, int toDir,
                         const std::string& toName, mode_t mode) = 0;
  virtual int readlinkAt(int dir, const std::string& name, std::string* target) = 0;
  virtual int symlinkAt(const std::string& target, int dir, const std::string& name) = 0;
  // Extended attributes of an item (a link's own); an empty name: `dir` itself.
  virtual int listxattrAt(int dir, const std::string& name, std::vector<std::string>* names) = 0;
  virtual int getxattrAt(int dir, const std::string& name, const std::string& attribute,
                         std::string* value) = 0;
  virtual int setxattrAt(int dir, const std::string& name, const std::string& attribute,
                         const std::string& value) = 0;

  static constexpr int kDeviceLockedError = EAGAIN;
  // The inode flag that forbids changing or removing an item.
  static constexpr int kImmutableFlag = 0x00000010;
  static const char* opName(Op op);
};

// Path calls for items in places others can change (a user's home): each
// parent directory is opened without following a link anywhere on its path
// and the item is named relative to it, so a parent swapped for a link
// cannot send the call elsewhere. 0 or an errno.
int VSARenameWithoutLinks(VSAFileSystem& fs, const std::string& from, const std::string& to);
int VSARemoveDirectoryWithoutLinks(VSAFileSystem& fs, const std::string& path);
