// Whole-tree operations of VSAFileManager: walking, syncing, removal, copying,
// ownership and ACL normalisation, disk usage.
#include <algorithm>
#include <cstring>
#include <set>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "platform/VSADirectoryStack.h"
#include "platform/VSAFileManager.h"
#include "platform/VSAFileManagerErrors.h"
#include "platform/VSAUniqueFd.h"

namespace {
constexpr const char* kOrigin = "VSAFileManager";

template <typename... A>
VSAErrorRef failACL(const char* function, const char* format, const A&... args) {
  std::string message = VSAFormat(format, args...);
  VSALogIn(VSALogCategory::FS, kVSALogError, function, "%s", message);
  return VSAError::make(VSAResult::kACLFailed, nullptr, function, __LINE__, "%s", message);
}

bool holdsMetadata(const std::string& path) {
  return path.find(kVSAMetadataFileName) != std::string::npos;
}
}  // namespace

int VSAFileManager::openParent(const std::string& path, int* fd, std::string* name) {
  *name = VSALastPathComponent(path);
  if (name->empty() || *name == "." || *name == "..") return EINVAL;
  std::string parent = VSADirectoryName(path);
  return fs_->openDirectory(parent.empty() ? "/" : parent, fd);
}

struct VSAFileManager::Walk {
  const WalkBlock& block;
  dev_t device;
  std::string failure;
  int failureErrno = 0;
  size_t entries = 0;
  bool fail(const std::string& path, int rc) {
    failure = path;
    failureErrno = rc;
    return false;
  }
  bool visit(const VSAWalkItem& item, WalkPhase phase) {
    ++entries;
    return block(item, phase);
  }
};

// Depth first without recursion: the directories being walked are on a
// stack that keeps few descriptors, so no depth is too deep. A directory is
// entered only when it is on the walk's device and is still the directory
// whose status the walk took.
bool VSAFileManager::walk(Walk& w, int parent, const std::string& name, const std::string& path,
                          const struct stat& st) {
  VSAWalkItem top{path, st, parent, name};
  if (!S_ISDIR(st.st_mode)) return w.visit(top, WalkPhase::Item);
  if (!w.visit(top, WalkPhase::Directory)) return false;
  VSADirectoryStack stack(*fs_, parent, path);
  if (int rc = stack.enter(name, &st, w.device)) return w.fail(path, rc);
  while (!stack.empty()) {
    if (const VSADirectoryEntry* e = stack.nextEntry()) {
      std::string child = VSAPathJoin(stack.path(), e->name);
      struct stat cst;
      if (int rc = fs_->statAt(stack.fd(), e->name, &cst)) return w.fail(child, rc);
      VSAWalkItem item{child, cst, stack.fd(), e->name};
      if (!S_ISDIR(cst.st_mode)) {
        if (!w.visit(item, WalkPhase::Item)) return false;
      } else if (!w.visit(item, WalkPhase::Directory)) {
        return false;
      } else if (cst.st_dev == w.device) {  // stay on one device: do not descend into mounts
        if (int rc = stack.enter(e->name, &cst, w.device)) return w.fail(child, rc);
      } else if (!w.visit(item, WalkPhase::DirectoryEnd)) {
        return false;
      }
      continue;
    }
    if (int rc = stack.reopenParent()) return w.fail(stack.path(), rc);
    VSAWalkItem item{stack.path(), stack.status(), stack.parentFd(), stack.name()};
    if (!w.visit(item, WalkPhase::DirectoryEnd)) return false;
    stack.pop();
  }
  return true;
}

bool VSAFileManager::traverseDirectory(const std::string& path, VSAErrorRef* error,
                                       const WalkBlock& block) {
  int raw = -1;
  std::string name;
  struct stat st;
  int rc = openParent(path, &raw, &name);
  VSAUniqueFd parent(raw);
  if (rc == 0) rc = fs_->statAt(parent.get(), name, &st);
  if (rc) {
    VSASetError(error,
                VSAFileManagerFail(rc, "traverseDirectory", "fts_open failed for %s with error %s",
                                   path, std::strerror(rc)));
    return false;
  }
  Walk w{block, st.st_dev, {}, 0, 0};
  walk(w, parent.get(), name, path, st);  // a walk stopped by the block is not an error
  VSALogIn(VSALogCategory::FS, kVSALogDebug, "TraversingDirectory", "%zu entries under %s",
           w.entries, path);
  if (w.failureErrno) {
    VSASetError(error,
                VSAFileManagerFail(w.failureErrno, "traverseDirectory", "Error for path %s: %s",
                                   w.failure, std::strerror(w.failureErrno)));
    return false;
  }
  return true;
}

bool VSAFileManager::syncDirectoriesAtURL(const std::string& path, VSAErrorRef* error) {
  // An empty directory has no entry to make durable: only the directories
  // something was met in are synced. One flag per directory being walked.
  std::vector<bool> holding;
  int failed = 0;
  std::string failedPath;
  bool walked = traverseDirectory(path, error, [&](const VSAWalkItem& item, WalkPhase phase) {
    if (phase != WalkPhase::DirectoryEnd) {
      if (!holding.empty()) holding.back() = true;
      if (phase == WalkPhase::Directory) holding.push_back(false);
      return true;
    }
    bool held = holding.back();
    holding.pop_back();
    if (!held) return true;
    int raw = -1;
    int rc = fs_->openDirectoryAt(item.directory, item.name, &raw);
    VSAUniqueFd directory(raw);
    if (rc == 0) rc = fs_->syncDirectory(directory.get());
    if (rc == 0) return true;
    failed = rc;
    failedPath = item.path;
    return false;
  });
  if (!walked) return false;
  if (failed == 0) return true;
  VSASetError(error, VSAFileManagerFail(failed, "syncDirectoriesAtURL", "sync of %@ failed: %s",
                                        failedPath, std::strerror(failed)));
  return false;
}

bool VSAFileManager::syncDirectoriesHoldingAtURL(const std::string& path,
                                                 const std::vector<std::string>& names,
                                                 VSAErrorRef* error) {
  // The holders: every proper prefix of a name, each once ("" is `path`).
  std::set<std::string> holders{""};
  for (const std::string& name : names)
    for (size_t slash = name.find('/'); slash != std::string::npos;
         slash = name.find('/', slash + 1))
      holders.insert(name.substr(0, slash));
  int raw = -1;
  int rc = fs_->openDirectory(path, &raw);
  VSAUniqueFd top(raw);
  std::string failedPath = path;
  for (auto it = holders.begin(); rc == 0 && it != holders.end(); ++it) {
    failedPath = VSAPathJoin(path, *it);
    // One component at a time: openDirectoryAt refuses a link as the last.
    VSAUniqueFd dir;
    int at = top.get();
    for (size_t start = 0; rc == 0 && start < it->size();) {
      size_t end = std::min(it->find('/', start), it->size());
      raw = -1;
      rc = fs_->openDirectoryAt(at, it->substr(start, end - start), &raw);
      dir.reset(raw);
      at = dir.get();
      start = end + 1;
    }
    if (rc == 0) rc = fs_->syncDirectory(at);
  }
  if (rc == 0) return true;
  VSASetError(error, VSAFileManagerFail(rc, "syncDirectoriesHoldingAtURL", "sync of %@ failed: %s",
                                        failedPath, std::strerror(rc)));
  return false;
}

struct VSAFileManager::Removal {
  dev_t device;
  int firstError = 0;
  const RemovalObserver* observer = nullptr;
  void record(const std::string& path, int rc) {
    if (rc == 0 || rc == ENOENT) return;
    VSALogIn(VSALogCategory::FS, kVSALogError, "_removefile_error_callback",
             "removefile hit error for %s : %s", path, std::strerror(rc));
    if (firstError == 0) firstError = rc;
  }
};

// Removes one entry of `directory`. An entry that refuses with EPERM because
// of the immutable flag (its own, or its directory's) is unlocked and removed.
int VSAFileManager::unlinkUnlocking(int directory, const std::string& name, const std::string& path,
                                    bool isDirectory) {
  int rc = fs_->unlinkAt(directory, name, isDirectory);
  if (rc != EPERM) return rc;
  for (const std::string& which : {std::string(), name}) {  // the directory, then the entry
    const std::string& shown = which.empty() ? VSADirectoryName(path) : path;
    int flags = 0;
    if (int frc = fs_->getFlagsAt(directory, which, &flags)) {
      VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
               "Failed to stat %s before unsetting UF_IMMUTABLE: %s", shown, std::strerror(frc));
      continue;
    }
    if (!(flags & VSAFileSystem::kImmutableFlag)) continue;
    if (int src = fs_->setFlagsAt(directory, which, flags & ~VSAFileSystem::kImmutableFlag)) {
      VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Failed to lchflags %s: %s", shown,
               std::strerror(src));
      return src;
    }
    VSALogIn(VSALogCategory::FS, kVSALogNotice, kOrigin, "Unset UF_IMMUTABLE on %s", shown);
    rc = fs_->unlinkAt(directory, name, isDirectory);
    if (rc != EPERM) break;
  }
  if (rc)
    VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "unlink of %s failed: %s", path,
             std::strerror(rc));
  return rc;
}

// Unlinks a non-directory, telling the observer its size: 0, EISDIR when it
// is a directory after all, or the error.
int VSAFileManager::removeFile(Removal& r, int directory, const std::string& name,
                               const std::string& path) {
  struct stat st;
  bool observed = r.observer && *r.observer && fs_->statAt(directory, name, &st) == 0;
  int rc = unlinkUnlocking(directory, name, path, false);
  if (rc == 0 && observed) (*r.observer)(static_cast<uint64_t>(st.st_size));
  return rc;
}

// Enters directory `name` of the stack's deepest directory to empty it;
// false (recorded) when it cannot be. Something that is no longer a
// directory is removed as it now is.
bool VSAFileManager::enterForRemoval(Removal& r, VSADirectoryStack& stack, const std::string& name,
                                     const std::string& path) {
  int listError = 0;
  int rc = stack.enter(name, nullptr, r.device, VSADirectoryStack::Listing::Tolerated, &listError);
  if (rc == ENOTDIR || rc == ELOOP) {
    int unlinked = unlinkUnlocking(stack.current(), name, path, false);
    r.record(path, unlinked == EISDIR ? rc : unlinked);  // EISDIR: a directory met twice
    return false;
  }
  r.record(path, rc);
  r.record(path, listError);  // entered all the same: its removal reports what stays
  return rc == 0;
}

// Depth first, going on past errors (the first is kept), without recursion:
// the directories being emptied are on a stack that keeps few descriptors,
// so no depth is too deep. Each directory is opened without following
// links and checked to be on the device the removal started on before
// anything in it is touched.
void VSAFileManager::removeTree(Removal& r, int parent, const std::string& name,
                                const std::string& path) {
  VSADirectoryStack stack(*fs_, parent, path);
  if (!enterForRemoval(r, stack, name, path)) return;
  while (!stack.empty()) {
    if (const VSADirectoryEntry* e = stack.nextEntry()) {
      std::string child = VSAPathJoin(stack.path(), e->name);
      if (e->type != VSADirectoryEntry::Type::Directory) {
        int rc = removeFile(r, stack.fd(), e->name, child);
        if (rc != EISDIR) {
          r.record(child, rc);
          continue;
        }
      }
      enterForRemoval(r, stack, e->name, child);
      continue;
    }
    std::string done = stack.path(), doneName = stack.name();
    // A directory that cannot be reached again is not acted on: stop here.
    if (int rc = stack.reopenParent()) return r.record(done, rc);
    int above = stack.parentFd();
    stack.pop();
    int rc = unlinkUnlocking(above, doneName, done, true);
    if (rc == ENOTDIR) rc = unlinkUnlocking(above, doneName, done, false);  // swapped meanwhile
    r.record(done, rc);
  }
}

bool VSAFileManager::removeItemAtURL(const std::string& path, VSAErrorRef* error,
                                     const RemovalObserver& observer) {
  if (path.empty()) {
    VSASetError(error, VSAFileManagerFail(EFAULT, "removeItemAtURL",
                                          "nil url passed to -removeItemAtURL:error:"));
    return false;
  }
  int raw = -1;
  std::string name;
  struct stat st;
  int rc = openParent(path, &raw, &name);
  VSAUniqueFd parent(raw);
  if (rc == 0) rc = fs_->statAt(parent.get(), name, &st);
  if (rc == ENOENT) return true;
  if (rc != 0) {
    VSASetError(error, VSAFileManagerFail(rc, "removeItemAtURL", "removefile of %@ failed: %s",
                                          path, std::strerror(rc)));
    return false;
  }
  Removal r{st.st_dev, 0, &observer};
  rc = S_ISDIR(st.st_mode) ? EISDIR : removeFile(r, parent.get(), name, path);
  if (rc == EISDIR)
    removeTree(r, parent.get(), name, path);
  else
    r.record(path, rc);
  if (r.firstError != 0) {
    VSASetError(error,
                VSAFileManagerFail(r.firstError, "removeItemAtURL", "removefile of %@ failed: %s",
                                   path, std::strerror(r.firstError)));
    return false;
  }
  return true;
}

bool VSAFileManager::removeFileAtURL(const std::string& path, VSAErrorRef* error) {
  int rc = fs_->unlink(path);
  if (rc == 0 || rc == ENOENT) return true;
  VSASetError(error, VSAFileManagerFail(rc, "removeFileAtURL", "unlink of %s failed: %s", path,
                                        std::strerror(rc)));
  return false;
}

bool VSAFileManager::restrictItemToRootAtURL(const std::string& path, VSAErrorRef* error) {
  int raw = -1;
  std::string name;
  int rc = openParent(path, &raw, &name);
  VSAUniqueFd parent(raw);
  if (rc == 0) rc = fs_->chownAt(parent.get(), name, 0, 0);
  if (rc == 0) rc = fs_->chmodAt(parent.get(), name, 0700);
  if (rc == 0) return true;
  VSASetError(error, VSAFileManagerFail(rc, "restrictItemToRootAtURL",
                                        "Could not give %@ to root: %s", path, std::strerror(rc)));
  return false;
}

// Owner, mode and extended attributes (ACLs included) of one item; an
// empty name stands for the directory itself.
int VSAFileManager::copyAttributes(int fromDir, const std::string& fromName, const struct stat& st,
                                   int toDir, const std::string& toName) {
  if (int rc = fs_->chownAt(toDir, toName, st.st_uid, st.st_gid)) return rc;
  if (int rc = fs_->chmodAt(toDir, toName, st.st_mode & 07777)) return rc;
  std::vector<std::string> names;
  if (fs_->listxattrAt(fromDir, fromName, &names) != 0) return 0;
  for (const auto& attribute : names) {
    std::string value;
    if (fs_->getxattrAt(fromDir, fromName, attribute, &value) != 0) continue;
    int rc = fs_->setxattrAt(toDir, toName, attribute, value);
    if (rc != 0 && rc != ENOTSUP) return rc;
  }
  return 0;
}

// One item that is not a directory: a link as a link, a regular file with
// its data and attributes.
int VSAFileManager::copyEntry(int fromDir, const std::string& fromName, const struct stat& st,
                              int toDir, const std::string& toName) {
  if (S_ISLNK(st.st_mode)) {
    std::string target;
    if (int rc = fs_->readlinkAt(fromDir, fromName, &target)) return rc;
    if (int rc = fs_->symlinkAt(target, toDir, toName)) return rc;
    fs_->chownAt(toDir, toName, st.st_uid, st.st_gid);
    return 0;
  }
  if (!S_ISREG(st.st_mode)) return 0;  // sockets, fifos and devices are not container content
  if (int rc = fs_->copyDataAt(fromDir, fromName, toDir, toName, 0600)) return rc;
  return copyAttributes(fromDir, fromName, st, toDir, toName);
}

// Copies item `fromName` of `fromDir` to the new `toName` of `toDir`,
// never following links. Directories are walked as every tree is: by
// descriptor, both trees on stacks that keep few open, on the source's
// device (mounts inside are not copied); each directory gets its owner,
// mode and attributes once its contents are in. Returns 0 or the first errno.
int VSAFileManager::copyTree(int fromDir, const std::string& fromName, const std::string& fromPath,
                             int toDir, const std::string& toName, const std::string& toPath) {
  struct stat st, target;
  if (int rc = fs_->statAt(fromDir, fromName, &st)) return rc;
  if (!S_ISDIR(st.st_mode)) return copyEntry(fromDir, fromName, st, toDir, toName);
  if (int rc = fs_->statAt(toDir, "", &target)) return rc;
  if (int rc = fs_->mkdirAt(toDir, toName, 0700)) return rc;
  using Listing = VSADirectoryStack::Listing;
  VSADirectoryStack from(*fs_, fromDir, fromPath), to(*fs_, toDir, toPath);
  int rc = from.enter(fromName, &st, st.st_dev);
  if (rc == 0) rc = to.enter(toName, nullptr, target.st_dev, Listing::None);
  while (rc == 0 && !from.empty()) {
    if (const VSADirectoryEntry* e = from.nextEntry()) {
      struct stat cst;
      if ((rc = fs_->statAt(from.fd(), e->name, &cst))) break;
      if (!S_ISDIR(cst.st_mode)) {
        rc = copyEntry(from.fd(), e->name, cst, to.fd(), e->name);
      } else if (cst.st_dev == st.st_dev && (rc = fs_->mkdirAt(to.fd(), e->name, 0700)) == 0 &&
                 (rc = from.enter(e->name, &cst, st.st_dev)) == 0) {
        rc = to.enter(e->name, nullptr, target.st_dev, Listing::None);
      }
      continue;
    }
    if ((rc = copyAttributes(from.fd(), "", from.status(), to.fd(), ""))) break;
    if ((rc = from.reopenParent()) || (rc = to.reopenParent())) break;
    from.pop();
    to.pop();
  }
  return rc;
}

bool VSAFileManager::standardizeOwnershipAtURL(const std::string& path, uid_t uid, gid_t gid,
                                               VSAErrorRef* error) {
  return traverseDirectory(path, error, [&](const VSAWalkItem& item, WalkPhase w) {
    if (w == WalkPhase::DirectoryEnd || holdsMetadata(item.path)) return true;
    // The top is re-owned only when its owner differs; its group alone may.
    bool compareGID = item.path != path;
    if (item.st.st_uid != uid || (compareGID && item.st.st_gid != gid)) {
      if (int rc = fs_->chownAt(item.directory, item.name, uid, gid))
        VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Could not chown %s: %s", item.path,
                 std::strerror(rc));
    }
    if (S_ISLNK(item.st.st_mode)) return true;
    mode_t mode = S_ISDIR(item.st.st_mode) || (item.st.st_mode & 0111) ? 0755 : 0644;
    if (int rc = fs_->chmodAt(item.directory, item.name, mode))
      VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Could not chmod %s: %s", item.path,
               std::strerror(rc));
    return true;
  });
}

std::optional<gid_t> VSAFileManager::systemUsersGroup(VSAErrorRef* error) {
  auto gid = userDatabase_->groupNamed("systemusers");
  if (!gid)
    VSASetError(error, failACL("_CreateSystemUserACEInACL", "mbr_identifier_to_uuid() failed: %s",
                               "no group named systemusers"));
  return gid;
}

bool VSAFileManager::setTopLevelSystemContainerACLAtURL(const std::string& path,
                                                        VSAErrorRef* error) {
  return setSystemContainerACLAtURL(path, VSASystemContainerACL::TopLevel, error);
}

bool VSAFileManager::setSystemContainerDirectoryACLAtURL(const std::string& path,
                                                         VSAErrorRef* error) {
  return setSystemContainerACLAtURL(path, VSASystemContainerACL::Directory, error);
}

bool VSAFileManager::setSystemContainerACLAtURL(const std::string& path, VSASystemContainerACL kind,
                                                VSAErrorRef* error) {
  auto gid = systemUsersGroup(error);
  if (!gid) return false;
  if (int rc = fs_->setSystemContainerACL(path, kind, *gid)) {
    VSASetError(error, failACL("setTopLevelSystemContainerACLAtURL", "Failed to set ACL on %@: %s",
                               path, std::strerror(rc)));
    return false;
  }
  return true;
}

bool VSAFileManager::standardizeACLsAtURL(const std::string& path, bool isSystemContainer,
                                          VSAErrorRef* error) {
  auto gid = systemUsersGroup(error);
  if (!gid) return false;
  return traverseDirectory(path, error, [&](const VSAWalkItem& item, WalkPhase w) {
    if (w == WalkPhase::DirectoryEnd || holdsMetadata(item.path)) return true;
    const struct stat& s = item.st;
    if (item.path == path && isSystemContainer && S_ISDIR(s.st_mode)) {
      if (int rc = fs_->setSystemContainerACLAt(item.directory, item.name,
                                                VSASystemContainerACL::TopLevel, *gid))
        VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
                 "Failed to set top level ACL on dir %s: %s", item.path, std::strerror(rc));
      return true;
    }
    if (!S_ISLNK(s.st_mode)) {
      bool dir = S_ISDIR(s.st_mode);
      // The ACL also sets the owner, group and other permissions to none:
      // access to system containers comes from the "systemusers" entry alone.
      if (int rc = fs_->setSystemContainerACLAt(
              item.directory, item.name,
              dir ? VSASystemContainerACL::Directory : VSASystemContainerACL::File, *gid))
        VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
                 dir ? "Failed to set ACL on dir %s: %s" : "Failed to set ACL on file %s: %s",
                 item.path, std::strerror(rc));
    }
    if (int rc = fs_->chownAt(item.directory, item.name, kVSANobodyID, kVSANobodyID))
      VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Could not chown %s: %s", item.path,
               std::strerror(rc));
    return true;
  });
}

bool VSAFileManager::standardizeAllSystemContainerACLsAtURL(const std::string& path,
                                                            VSAErrorRef* error) {
  VSAErrorRef listError;
  auto items = urlsForItemsInDirectoryAtURL(path, &listError);
  if (!items) {
    if (listError && listError->code() == ENOENT) return true;
    VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Failed to get items at URL%@ : %@", path,
             listError);
    VSASetError(error, listError);
    return false;
  }
  if (items->empty()) return true;
  std::string names;
  for (const auto& i : *items) names += i.path + " ";
  VSALogIn(VSALogCategory::FS, kVSALogNotice, kOrigin,
           "Potential containers requiring ACL migration: %@", names);
  bool ok = true;
  for (const auto& item : *items) {
    VSAErrorRef itemError;
    if (!standardizeACLsAtURL(item.path, true, &itemError)) {
      VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
               "Failed to set system container ACL at %@: %@", item.path, itemError);
      VSASetError(error, itemError);
      ok = false;
    }
  }
  return ok;
}

uint64_t VSAFileManager::diskUsageForURL(const std::string& path) {
  uint64_t total = 0, nodes = 0;
  VSAErrorRef error;
  traverseDirectory(path, &error, [&](const VSAWalkItem& item, WalkPhase w) {
    if (w != WalkPhase::DirectoryEnd) {
      total += static_cast<uint64_t>(item.st.st_size);
      ++nodes;
    }
    return true;
  });
  VSALogIn(VSALogCategory::FS, kVSALogDebug, "CalculatingDiskUsage", "%llu nodes, %llu bytes in %s",
           nodes, total, path);
  return total;
}

uint64_t VSAFileManager::fastDiskUsageForURL(const std::string& path) {
  uint64_t bytes = 0;
  int rc = fs_->directoryStatistics(path, &bytes);
  if (rc != 0) {
    if (int m = fs_->maintainDirectoryStatistics(path)) {
      VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
               "Failed to set maintain-dir-stats on %s: (err %d) %s", path, m, std::strerror(m));
    } else {
      VSALogIn(VSALogCategory::FS, kVSALogNotice, kOrigin, "Enabled fast directory sizing on [%s]",
               path);
      rc = fs_->directoryStatistics(path, &bytes);
    }
  }
  if (rc == 0) return bytes;
  VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Failed to get dirstats on %s: (err %d) %s",
           path, rc, std::strerror(rc));
  return diskUsageForURL(path);
}
