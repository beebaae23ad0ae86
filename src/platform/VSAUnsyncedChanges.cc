#include "platform/VSAUnsyncedChanges.h"

#include <sys/stat.h>

#include <cstdio>
#include <set>

#include "base/VSAPathString.h"

namespace {
// Deeper trees are not made by the daemon; the bound keeps a removal of a
// hostile tree from exhausting the stack.
constexpr int kMaxRemovalDepth = 256;

std::string parentOf(const std::string& path) {
  std::string parent = VSADirectoryName(path);
  if (parent.empty()) parent = path.rfind('/', 0) == 0 ? "/" : ".";
  return parent;
}
}  // namespace

VSAUnsyncedChanges::VSAUnsyncedChanges(std::shared_ptr<VSAFileSystem> disk)
    : disk_(std::move(disk)) {}

VSAUnsyncedChanges::~VSAUnsyncedChanges() = default;

void VSAUnsyncedChanges::start() {
  std::lock_guard lock(mutex_);
  changes_.clear();
  directories_.clear();
  tracking_ = true;
  powerLost_ = false;
}

void VSAUnsyncedChanges::clear() {
  std::lock_guard lock(mutex_);
  changes_.clear();
  directories_.clear();
  tracking_ = false;
  powerLost_ = false;
}

bool VSAUnsyncedChanges::tracking() const {
  std::lock_guard lock(mutex_);
  return tracking_;
}

size_t VSAUnsyncedChanges::pending() const {
  std::lock_guard lock(mutex_);
  return changes_.size();
}

template <typename F>
void VSAUnsyncedChanges::atParent(const std::string& path, F&& body) {
  if (!tracking()) return;  // no descriptor to open when nothing is tracked
  int raw = -1;
  if (disk_->openDirectory(parentOf(path), &raw) != 0) return;
  VSAUniqueFd dir(raw);
  body(dir.get(), VSALastPathComponent(path));
}

bool VSAUnsyncedChanges::holdLocked(int dir, DirectoryKey* key) {
  struct stat st;
  if (disk_->statAt(dir, "", &st) != 0) return false;
  *key = {st.st_dev, st.st_ino};
  if (directories_.count(*key)) return true;
  // A descriptor of our own: the caller closes its one when it likes.
  int own = -1;
  if (disk_->openDirectoryAt(dir, ".", &own) != 0) return false;
  directories_.emplace(*key, VSAUniqueFd(own));
  return true;
}

int VSAUnsyncedChanges::descriptorLocked(const DirectoryKey& key) const {
  auto it = directories_.find(key);
  return it == directories_.end() ? -1 : it->second.get();
}

void VSAUnsyncedChanges::addLocked(Change change) {
  if (!powerLost_) {
    changes_.push_back(std::move(change));
    return;
  }
  // The call was under way when the power failed: nothing it did was synced.
  undoLocked(change);
  dropUnreferencedLocked();
}

void VSAUnsyncedChanges::created(const std::string& path) {
  atParent(path, [&](int dir, const std::string& name) { created(dir, name); });
}

void VSAUnsyncedChanges::created(int dir, const std::string& name) {
  std::lock_guard lock(mutex_);
  if (!tracking_) return;
  Change change{Change::Kind::Create, {}, name, 0, {}, {}, 0};
  struct stat st;
  if (!holdLocked(dir, &change.dir) || disk_->statAt(dir, name, &st) != 0) return;
  change.item = st.st_ino;
  addLocked(std::move(change));
}

void VSAUnsyncedChanges::renamed(const std::string& from, const std::string& to) {
  atParent(from, [&](int fromDir, const std::string& fromName) {
    atParent(to, [&](int toDir, const std::string& toName) {
      renamed(fromDir, fromName, toDir, toName);
    });
  });
}

void VSAUnsyncedChanges::renamed(int fromDir, const std::string& fromName, int toDir,
                                 const std::string& toName) {
  std::lock_guard lock(mutex_);
  if (!tracking_) return;
  Change change{Change::Kind::Rename, {}, fromName, 0, {}, toName, 0};
  struct stat st;
  if (!holdLocked(fromDir, &change.dir) || !holdLocked(toDir, &change.otherDir) ||
      disk_->statAt(toDir, toName, &st) != 0)
    return;
  change.item = st.st_ino;
  addLocked(std::move(change));
}

void VSAUnsyncedChanges::exchanged(const std::string& a, const std::string& b) {
  atParent(a, [&](int aDir, const std::string& aName) {
    atParent(b, [&](int bDir, const std::string& bName) {
      std::lock_guard lock(mutex_);
      if (!tracking_) return;
      Change change{Change::Kind::Exchange, {}, aName, 0, {}, bName, 0};
      struct stat atA, atB;
      if (!holdLocked(aDir, &change.dir) || !holdLocked(bDir, &change.otherDir) ||
          disk_->statAt(aDir, aName, &atA) != 0 || disk_->statAt(bDir, bName, &atB) != 0)
        return;
      change.item = atA.st_ino;
      change.otherItem = atB.st_ino;
      addLocked(std::move(change));
    });
  });
}

void VSAUnsyncedChanges::syncedParentOf(const std::string& path) {
  atParent(path, [&](int dir, const std::string&) { synced(dir); });
}

void VSAUnsyncedChanges::synced(int dir) {
  struct stat st;
  if (!tracking() || disk_->statAt(dir, "", &st) != 0) return;
  DirectoryKey key{st.st_dev, st.st_ino};
  std::lock_guard lock(mutex_);
  if (powerLost_) return;  // a sync under way when the power failed did not finish
  std::erase_if(changes_, [&](const Change& c) {
    return c.dir == key || (c.kind != Change::Kind::Create && c.otherDir == key);
  });
  dropUnreferencedLocked();
}

void VSAUnsyncedChanges::losePower() {
  std::lock_guard lock(mutex_);
  if (!tracking_ || powerLost_) return;
  powerLost_ = true;
  for (auto it = changes_.rbegin(); it != changes_.rend(); ++it) undoLocked(*it);
  changes_.clear();
  dropUnreferencedLocked();
}

void VSAUnsyncedChanges::undoLocked(const Change& change) {
  int dir = descriptorLocked(change.dir);
  struct stat st;
  switch (change.kind) {
    case Change::Kind::Create:
      // Only the item the change made: a name reused since is left alone.
      if (dir >= 0 && disk_->statAt(dir, change.name, &st) == 0 && st.st_ino == change.item)
        removeTreeLocked(dir, change.name, 0);
      return;
    case Change::Kind::Rename: {
      int to = descriptorLocked(change.otherDir);
      if (dir >= 0 && to >= 0 && disk_->statAt(to, change.otherName, &st) == 0 &&
          st.st_ino == change.item)
        disk_->renameAt(to, change.otherName, dir, change.name);
      return;
    }
    case Change::Kind::Exchange: {
      int other = descriptorLocked(change.otherDir);
      struct stat otherSt;
      if (dir >= 0 && other >= 0 && disk_->statAt(dir, change.name, &st) == 0 &&
          disk_->statAt(other, change.otherName, &otherSt) == 0 && st.st_ino == change.item &&
          otherSt.st_ino == change.otherItem)
        ::renameat2(dir, change.name.c_str(), other, change.otherName.c_str(), RENAME_EXCHANGE);
      return;
    }
  }
}

void VSAUnsyncedChanges::removeTreeLocked(int dir, const std::string& name, int depth) {
  struct stat st;
  if (depth > kMaxRemovalDepth || disk_->statAt(dir, name, &st) != 0) return;
  bool isDirectory = S_ISDIR(st.st_mode);
  if (isDirectory) {
    int raw = -1;
    if (disk_->openDirectoryAt(dir, name, &raw) == 0) {
      VSAUniqueFd inner(raw);
      std::vector<VSADirectoryEntry> entries;
      if (disk_->readDirectoryAt(inner.get(), &entries) == 0)
        for (const auto& entry : entries) removeTreeLocked(inner.get(), entry.name, depth + 1);
    }
  }
  if (disk_->unlinkAt(dir, name, isDirectory) != EPERM) return;
  // An immutable item: unlocked first, as the daemon's own removals do.
  int flags = 0;
  if (disk_->getFlagsAt(dir, name, &flags) == 0 &&
      disk_->setFlagsAt(dir, name, flags & ~VSAFileSystem::kImmutableFlag) == 0)
    disk_->unlinkAt(dir, name, isDirectory);
}

void VSAUnsyncedChanges::dropUnreferencedLocked() {
  std::set<DirectoryKey> used;
  for (const auto& c : changes_) {
    used.insert(c.dir);
    if (c.kind != Change::Kind::Create) used.insert(c.otherDir);
  }
  std::erase_if(directories_, [&](const auto& entry) { return !used.count(entry.first); });
}
