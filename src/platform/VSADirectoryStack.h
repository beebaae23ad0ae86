// The directories from the top of a tree walk down to the one being worked
// on, for walks of any depth with a bounded number of open descriptors.
//
// Each directory is entered by the walk with openat (no link followed) and
// recorded with its device and inode. The walk's top directory keeps its
// descriptor for the whole walk; of the directories below it only the
// deepest `budget` keep theirs. Coming back up to a directory whose
// descriptor was let go reopens it through ".." of its child and accepts it
// only when device and inode are the ones recorded on the way down; failing
// that (something was moved meanwhile), it is reopened by name from the
// top, each step checked the same way. A directory that can be reached
// neither way is not acted on again (ESTALE).
//
// Each directory also carries its listing and a cursor into it, and the
// stack keeps the path of the deepest directory (for logs): memory grows
// with the depth, descriptors do not. Not thread-safe; one walk per stack.
#pragma once

#include <sys/stat.h>

#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/VSAFileSystem.h"
#include "platform/VSAUniqueFd.h"

// How many descriptors a walk keeps open besides the walk's top (and the
// directory holding it).
inline constexpr size_t kVSAWalkDescriptorBudget = 32;

class VSADirectoryStack {
 public:
  // `base`: the directory holding the walk's top, open for the whole walk
  // (the caller's); `topPath`: the path of the top, as the caller names it.
  VSADirectoryStack(VSAFileSystem& fs, int base, const std::string& topPath,
                    size_t budget = kVSAWalkDescriptorBudget);

  bool empty() const { return frames_.empty(); }

  enum class Listing { Required, Tolerated, None };
  // Opens directory `name` of the deepest directory (of the base when the
  // stack is empty) without following a link, and makes it the deepest.
  // It must be the directory `expected` describes when given (ESTALE
  // otherwise), lie on `device` (EXDEV) and not be on the stack already
  // (ELOOP: a way back into itself, such as a bind mount). Its listing is
  // read unless `listing` is None; with Tolerated, a listing that fails is
  // `*listError` and the directory is entered with no entries. Opening a
  // link or a non-directory fails as the open does (ELOOP, ENOTDIR).
  int enter(const std::string& name, const struct stat* expected, dev_t device,
            Listing listing = Listing::Required, int* listError = nullptr);
  // The deepest directory, or the base when the stack is empty.
  int current() const { return frames_.empty() ? base_ : fd(); }

  // The deepest directory: its descriptor (always open), name in its
  // parent, status, path, and the next entry of its listing (nullptr once
  // all were taken).
  int fd() const { return frames_.back().fd.get(); }
  const std::string& name() const { return frames_.back().name; }
  const struct stat& status() const { return frames_.back().st; }
  const std::string& path() const { return path_; }
  const VSADirectoryEntry* nextEntry();

  // Makes sure the deepest directory's parent is open (see above): 0 or an
  // errno; parentFd() is valid after it succeeds.
  int reopenParent();
  int parentFd() const;
  // Closes the deepest directory and makes its parent the deepest; needs
  // reopenParent() to have succeeded first.
  void pop();

 private:
  struct Frame {
    std::string name;
    VSAUniqueFd fd;  // let go above the deepest `budget` directories
    struct stat st;
    std::vector<VSADirectoryEntry> entries;
    size_t next = 0;
    size_t parentPathLength = 0;
  };
  void push(const std::string& name, VSAUniqueFd fd, const struct stat& st,
            std::vector<VSADirectoryEntry> entries);
  int reopenThroughDotDot(Frame& parent, int child);
  int reopenFromBottom(size_t index);
  static bool same(const struct stat& a, const struct stat& b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
  }

  VSAFileSystem& fs_;
  int base_;
  size_t budget_;
  std::vector<Frame> frames_;
  std::set<std::pair<dev_t, ino_t>> identities_;
  // Frames [firstOpen_, size) hold descriptors, and frame 0 (the top) always does.
  size_t firstOpen_ = 1;
  std::string path_;
};
