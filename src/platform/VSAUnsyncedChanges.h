// What a power loss takes back: the changes made to directories that were
// not yet made durable, kept in the order they were made so that they can be
// undone on the real disk, newest first.
//
// The durability rules are those VSAFileSystem promises:
//   - a new entry (a directory, file or link made in directory D) is durable
//     once D has been synced after it; the item's own contents are a matter
//     of the item (a synced directory whose own entry was not synced
//     vanishes with everything below it);
//   - a rename is one change of the file system's journal, carried by both
//     directories: it is durable once either of them has been synced after
//     it (rename and renameAt sync the destination at once, so they are
//     durable when they return; renameWithoutSync waits for a later sync);
//   - an exchange syncs both directories and is durable when it returns;
//   - writeFile and copyDataAt sync the file's data: only the entry of a
//     file they make is a change here, never its content.
// A removal is not undone: what was removed is not kept, so an unsynced
// removal stays removed. A removal that comes back after a power loss loses
// nothing; it can only bring back what the daemon took away, and what the
// daemon removes outright is meant to be found again safely by the next
// start (death row's content, temporary files, a completed restore beside
// its marker, a pending change that is redone). A removal whose return would
// do harm is a bug this model cannot find. Likewise, an unsynced rename over
// an existing item is undone without bringing back the item it replaced.
// Changes of an item's attributes (mode, owner, extended attributes, inode
// flags) are not modelled either: they stay as made.
//
// Directories are known by identity (device and inode: fstat of the call's
// descriptor, or of the parent directory opened for a path), never by path:
// a change made inside a staging directory is still undone after that
// directory has been renamed elsewhere. One descriptor per directory named
// by a pending change stays open until the change is durable or forgotten,
// which also keeps the directory's inode number from being reused meanwhile.
//
// Tracking starts with start() and ends with clear(). losePower() undoes
// every pending change, newest first, through `disk` (the real file system,
// not the fault-injecting layer above it); a change reported after that (a
// call that was under way when the power failed) is undone as it arrives.
// Undoing is best effort: what cannot be undone (a name taken since) is left.
// Thread-safe.
#pragma once

#include <sys/types.h>

#include <compare>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/VSAFileSystem.h"
#include "platform/VSAUniqueFd.h"

class VSAUnsyncedChanges {
 public:
  explicit VSAUnsyncedChanges(std::shared_ptr<VSAFileSystem> disk);
  ~VSAUnsyncedChanges();
  VSAUnsyncedChanges(const VSAUnsyncedChanges&) = delete;
  VSAUnsyncedChanges& operator=(const VSAUnsyncedChanges&) = delete;

  // Forgets everything and starts tracking.
  void start();
  // Forgets everything and stops tracking.
  void clear();
  bool tracking() const;
  // Changes not yet durable.
  size_t pending() const;

  // Reports of calls that succeeded. Path forms name the item by its full
  // path; descriptor forms by its directory (any descriptor of it) and name.
  void created(const std::string& path);
  void created(int dir, const std::string& name);
  void renamed(const std::string& from, const std::string& to);
  void renamed(int fromDir, const std::string& fromName, int toDir, const std::string& toName);
  void exchanged(const std::string& a, const std::string& b);
  // The directory holding `path` was synced.
  void syncedParentOf(const std::string& path);
  void synced(int dir);

  // The power fails: every change not yet durable is undone, newest first.
  void losePower();

 private:
  struct DirectoryKey {
    dev_t dev = 0;
    ino_t ino = 0;
    auto operator<=>(const DirectoryKey&) const = default;
  };
  struct Change {
    enum class Kind { Create, Rename, Exchange } kind;
    // Create: the new entry. Rename: the source. Exchange: one side.
    DirectoryKey dir;
    std::string name;
    ino_t item = 0;  // the item the entry named when the change was made
    // Rename: the destination. Exchange: the other side.
    DirectoryKey otherDir;
    std::string otherName;
    ino_t otherItem = 0;
  };

  // The key of `dir`, opening a descriptor of it to hold when it is new.
  bool holdLocked(int dir, DirectoryKey* key);
  int descriptorLocked(const DirectoryKey& key) const;
  void addLocked(Change change);
  void undoLocked(const Change& change);
  void removeTreeLocked(int dir, const std::string& name, int depth);
  void dropUnreferencedLocked();
  // Runs `body` with a descriptor of the directory holding `path` and its name.
  template <typename F>
  void atParent(const std::string& path, F&& body);

  std::shared_ptr<VSAFileSystem> disk_;
  mutable std::mutex mutex_;
  bool tracking_ = false;
  bool powerLost_ = false;
  std::vector<Change> changes_;  // oldest first
  std::map<DirectoryKey, VSAUniqueFd> directories_;
};
