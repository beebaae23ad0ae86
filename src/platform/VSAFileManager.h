// The one place where the daemon touches the file system (through the
// injected VSAFileSystem): safe resolution of client paths inside a
// container, directory creation with mode, owner and protection class, move,
// copy and recursive removal, ownership and ACL normalisation of trees,
// protection classes, listing, walking, temporary directories, disk usage
// and home directories.
//
// Every operation is synchronous and may be called from any thread; the
// manager holds no state of its own. Failures come back as POSIX-domain
// errors (or code 63 for system-container ACLs) carrying the message that is
// also logged. Tree operations log per-entry failures and go on.
#pragma once

#include <sys/stat.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "platform/VSAFileSystem.h"
#include "platform/VSAUniqueFd.h"
#include "platform/VSAUserDatabase.h"

inline constexpr const char* kVSAMetadataFileName = ".com.tamsk.vessa_keeper.metadata.plist";
inline constexpr uint32_t kVSANoProtectionClass = 0xFFFFFFFF;
inline constexpr uid_t kVSANobodyID = 4294967294u;  // owner of system container items

class VSADirectoryStack;

struct VSADirectoryItem {
  std::string path;
  bool isDirectory = false;
};

// One item met by a walk: its path (for logs), its status, and the directory
// descriptor and name through which it is acted on without a path lookup.
struct VSAWalkItem {
  const std::string& path;
  const struct stat& st;
  int directory;
  const std::string& name;
};

class VSAFileManager {
 public:
  enum class WalkPhase { Directory, DirectoryEnd, Item };
  using WalkBlock = std::function<bool(const VSAWalkItem& item, WalkPhase)>;

  VSAFileManager(std::shared_ptr<VSAFileSystem> fileSystem,
                 std::shared_ptr<const VSAUserDatabase> userDatabase);

  VSAFileSystem& fileSystem() const { return *fs_; }

  // The resolved path of `path` if it stays strictly inside `base`, else nothing.
  std::optional<std::string> realPathForURL(const std::string& path, const std::string& base);

  // A directory the call makes itself is given to `owner` (when not root) and
  // `group` (by default the owner's primary group); one that was there already
  // keeps its owner. A link or non-directory in the way is ENOTDIR or ELOOP.
  bool createDirectoryAtURL(const std::string& path, bool withIntermediateDirectories, mode_t mode,
                            uid_t owner, uint32_t protectionClass, VSAErrorRef* error,
                            std::optional<gid_t> group = std::nullopt);
  // The same with intermediate directories, made durable: the directory
  // holding each directory the call made is synced before it returns. For a
  // directory that things are then committed into by rename (such a commit
  // syncs the directory, not the entry that names it).
  bool createDurableDirectoryAtURL(const std::string& path, mode_t mode, uid_t owner,
                                   uint32_t protectionClass, VSAErrorRef* error,
                                   std::optional<gid_t> group = std::nullopt);
  // Makes the missing directories of `relativePath` (plain names joined by
  // "/") below directory `base`, by descriptor and on `base`'s device: each
  // one made gets `mode` and is given to `owner`:`group`; one already there
  // keeps its owner. A link or non-directory in the way is ELOOP or ENOTDIR.
  bool createDirectoriesAt(int base, const std::string& relativePath, mode_t mode, uid_t owner,
                           gid_t group, VSAErrorRef* error);
  // `durable` false: the rename is not synced (for moves a crash may undo
  // because they are redone, such as orphans sent to death row at boot).
  bool moveItemAtURL(const std::string& from, const std::string& to, VSAErrorRef* error,
                     bool durable = true);
  // Swaps two existing items atomically (each takes the other's place).
  bool exchangeItemsAtURL(const std::string& a, const std::string& b, VSAErrorRef* error);
  // Syncs every directory of the tree at `path`, deepest first, so that the
  // entries made in it survive a power loss: what is built in staging is
  // synced before the rename that commits it, which makes only the tree's
  // own entry durable.
  bool syncDirectoriesAtURL(const std::string& path, VSAErrorRef* error);
  // The same when the caller knows what it made: syncs `path` and every
  // directory below it that holds one of `names` (paths relative to it),
  // reached one component at a time without following a link; no listing.
  bool syncDirectoriesHoldingAtURL(const std::string& path, const std::vector<std::string>& names,
                                   VSAErrorRef* error);
  bool moveItemIfExistsAtURL(const std::string& from, const std::string& to, VSAErrorRef* error);
  bool copyItemAtURL(const std::string& from, const std::string& to, VSAErrorRef* error);
  // Writes a whole file atomically and durably: a temporary file beside it
  // (".tmp-" and a fresh UUID), fsynced, given `protectionClass` when set,
  // renamed over `path`, and the directory fsynced. On failure the temporary
  // file is removed and `path` is as it was.
  bool writeFileAtomicallyAtURL(const std::string& path, const std::vector<uint8_t>& bytes,
                                mode_t mode, std::optional<int> protectionClass,
                                VSAErrorRef* error);
  // Removes the temporary files that writes interrupted by a crash left in
  // `directory`; returns how many went.
  int removeUnfinishedWritesInDirectoryAtURL(const std::string& directory);
  bool copyItemIfExistsAtURL(const std::string& from, const std::string& to, VSAErrorRef* error);
  // Told of each file a removal unlinks, with its size (progress of long removals).
  using RemovalObserver = std::function<void(uint64_t bytes)>;
  // Recursive, through directory descriptors and on one device, at any
  // depth with a bounded number of descriptors; a missing item is success;
  // immutable items are unlocked and removed. An observer costs one status
  // call per file.
  bool removeItemAtURL(const std::string& path, VSAErrorRef* error,
                       const RemovalObserver& observer = {});
  // One file or link, never a tree (a directory is EISDIR); missing is success.
  bool removeFileAtURL(const std::string& path, VSAErrorRef* error);
  // Gives an item (a container sent to death row) to root with mode 0700, so
  // that its former owner cannot reach into it while it is removed.
  bool restrictItemToRootAtURL(const std::string& path, VSAErrorRef* error);
  bool standardizeOwnershipAtURL(const std::string& path, uid_t uid, gid_t gid, VSAErrorRef* error);

  bool setTopLevelSystemContainerACLAtURL(const std::string& path, VSAErrorRef* error);
  // The ACL of a directory inside a system container, on one directory.
  bool setSystemContainerDirectoryACLAtURL(const std::string& path, VSAErrorRef* error);
  bool standardizeACLsAtURL(const std::string& path, bool isSystemContainer, VSAErrorRef* error);
  bool standardizeACLsForSystemContainerAtURL(const std::string& path, VSAErrorRef* error) {
    return standardizeACLsAtURL(path, true, error);
  }
  bool standardizeAllSystemContainerACLsAtURL(const std::string& path, VSAErrorRef* error);

  bool dataProtectionClassOfItemAtURL(const std::string& path, int* protectionClass,
                                      VSAErrorRef* error);
  // With a predicate, the class changes only when the predicate accepts the current one.
  bool setDataProtectionClassOfItemAtURL(const std::string& path, int protectionClass,
                                         const std::function<bool(int)>& ifPredicate,
                                         VSAErrorRef* error);
  // The same for an item met by a walk.
  bool setDataProtectionClassOfItem(const VSAWalkItem& item, int protectionClass,
                                    VSAErrorRef* error);

  bool itemExistsAtURL(const std::string& path);
  // A directory (not a link to one) is at `path`: one status call, no log.
  bool directoryExistsAtURL(const std::string& path);
  bool itemDoesNotExistAtURL(const std::string& path);
  // Visible entries (names not starting with ".") of one directory.
  std::optional<std::vector<VSADirectoryItem>> urlsForItemsInDirectoryAtURL(const std::string& path,
                                                                            VSAErrorRef* error);
  // The same, listed through a descriptor of the directory (no link anywhere
  // in `path`) that comes back in `dir`: the entries can then be opened
  // relative to it, the kernel walking only what lies below.
  std::optional<std::vector<VSADirectoryItem>> urlsForItemsInDirectoryAtURL(const std::string& path,
                                                                            VSAUniqueFd* dir,
                                                                            VSAErrorRef* error);
  // Walks a tree on one device through directory descriptors, at any depth
  // with a bounded number of descriptors open (VSADirectoryStack);
  // directories are reported before and after their contents. The block
  // stops the walk by returning false. No link is followed; a directory
  // swapped for something else between its status and its opening, or one
  // that cannot be reached again on the way back up, is a failure.
  bool traverseDirectory(const std::string& path, VSAErrorRef* error, const WalkBlock& block);
  std::optional<std::string> createTemporaryDirectoryInDirectoryURL(
      const std::string& directory, VSAErrorRef* error,
      const std::string& withNamePrefix = "temp.");

  // Logs a tree, one line per item (path, type, mode, owner, size): a
  // debugging aid for data that should not be there.
  void printDirectoryStructureAtURL(const std::string& path);
  // Total apparent size of a tree in bytes (a full walk).
  uint64_t diskUsageForURL(const std::string& path);
  // The file system's statistics for the tree; on first use it asks the
  // file system to keep them; any failure falls back to the full walk.
  uint64_t fastDiskUsageForURL(const std::string& path);
  std::string homeDirectoryURLForPOSIXUID(uid_t uid) const;

 private:
  // Visible entries of a listing that gave `rc`, in inode order.
  std::optional<std::vector<VSADirectoryItem>> itemsOfDirectory(
      const std::string& path, int rc, const std::vector<VSADirectoryEntry>& entries,
      VSAErrorRef* error);
  bool checkSource(const std::string& from, const char* fn, bool* missing, VSAErrorRef* error);
  struct MoveOptions {
    bool failIfSourceMissing = true;  // false: a missing source is success
    bool durable = true;              // false: the rename is not synced
  };
  bool moveItem(const std::string& from, const std::string& to, MoveOptions options,
                VSAErrorRef* error);
  bool copyItem(const std::string& from, const std::string& to, bool failIfSrcMissing,
                VSAErrorRef* error);
  int copyTree(int fromDir, const std::string& fromName, const std::string& fromPath, int toDir,
               const std::string& toName, const std::string& toPath);
  int copyEntry(int fromDir, const std::string& fromName, const struct stat& st, int toDir,
                const std::string& toName);
  int copyAttributes(int fromDir, const std::string& fromName, const struct stat& st, int toDir,
                     const std::string& toName);
  struct Walk;
  struct Removal;
  bool walk(Walk& w, int parent, const std::string& name, const std::string& path,
            const struct stat& st);
  void removeTree(Removal& r, int parent, const std::string& name, const std::string& path);
  bool enterForRemoval(Removal& r, VSADirectoryStack& stack, const std::string& name,
                       const std::string& path);
  int removeFile(Removal& r, int directory, const std::string& name, const std::string& path);
  int unlinkUnlocking(int directory, const std::string& name, const std::string& path,
                      bool isDirectory);
  // Opens the directory holding `path` and names its last component: 0 or an errno.
  int openParent(const std::string& path, int* fd, std::string* name);
  std::optional<std::string> realPathAllowingMissing(const std::string& path);
  std::optional<gid_t> systemUsersGroup(VSAErrorRef* error);
  bool setSystemContainerACLAtURL(const std::string& path, VSASystemContainerACL kind,
                                  VSAErrorRef* error);
  bool createDirectory(const std::string& path, bool intermediates, bool durable, mode_t mode,
                       uid_t owner, uint32_t protectionClass, VSAErrorRef* error,
                       std::optional<gid_t> group);
  // mkdir -p from the bottom up: 0 or an errno. `made` tells how many
  // directories this call made: `path` itself and the parents above it.
  int makePath(const std::string& path, mode_t mode, int* made, int depth = 0);

  std::shared_ptr<VSAFileSystem> fs_;
  std::shared_ptr<const VSAUserDatabase> userDatabase_;
};
