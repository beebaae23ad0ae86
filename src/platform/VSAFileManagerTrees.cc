// Whole-tree operations of VSAFileManager: walking, removal, copying,
// ownership and ACL normalisation, disk usage.
#include <cstring>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
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
};

bool VSAFileManager::walk(Walk& w, int directory, const std::string& name, const std::string& path,
                          const struct stat& st, int depth) {
  VSAWalkItem item{path, st, directory, name};
  ++w.entries;
  if (!S_ISDIR(st.st_mode)) return w.block(item, WalkPhase::Item);
  if (!w.block(item, WalkPhase::Directory)) return false;
  if (st.st_dev == w.device) {  // stay on one device: do not descend into mounts
    if (depth >= kVSAMaxWalkDepth) return w.fail(path, ELOOP);
    int raw = -1;
    if (int rc = fs_->openDirectoryAt(directory, name, &raw)) return w.fail(path, rc);
    VSAUniqueFd fd(raw);
    struct stat opened;
    if (int rc = fs_->statAt(fd.get(), "", &opened)) return w.fail(path, rc);
    if (opened.st_dev != st.st_dev || opened.st_ino != st.st_ino) return w.fail(path, ESTALE);
    std::vector<VSADirectoryEntry> entries;
    if (int rc = fs_->readDirectoryAt(fd.get(), &entries)) return w.fail(path, rc);
    for (const auto& e : entries) {
      std::string child = VSAPathJoin(path, e.name);
      struct stat cst;
      if (int rc = fs_->statAt(fd.get(), e.name, &cst)) return w.fail(child, rc);
      if (!walk(w, fd.get(), e.name, child, cst, depth + 1)) return false;
    }
  }
  ++w.entries;
  return w.block(item, WalkPhase::DirectoryEnd);
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
  walk(w, parent.get(), name, path, st, 0);  // a walk stopped by the block is not an error
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

void VSAFileManager::removeDirectoryContents(Removal& r, int directory, const std::string& path,
                                             int depth) {
  std::vector<VSADirectoryEntry> entries;
  if (int rc = fs_->readDirectoryAt(directory, &entries)) r.record(path, rc);
  for (const auto& e : entries)
    removeEntry(r, directory, e.name, VSAPathJoin(path, e.name),
                e.type == VSADirectoryEntry::Type::Directory, depth + 1);
}

// Depth first, going on past errors (the first is kept). Each directory is
// opened without following links and checked to be on the device the
// removal started on before anything in it is touched.
void VSAFileManager::removeEntry(Removal& r, int directory, const std::string& name,
                                 const std::string& path, bool isDirectory, int depth) {
  if (!isDirectory) {
    struct stat st;
    bool observed = r.observer && *r.observer && fs_->statAt(directory, name, &st) == 0;
    int rc = unlinkUnlocking(directory, name, path, false);
    if (rc == 0 && observed) (*r.observer)(static_cast<uint64_t>(st.st_size));
    if (rc != EISDIR) return r.record(path, rc);
  }
  if (depth >= kVSAMaxWalkDepth) return r.record(path, ELOOP);
  int raw = -1;
  int rc = fs_->openDirectoryAt(directory, name, &raw);
  VSAUniqueFd fd(raw);
  if (rc == ENOTDIR || rc == ELOOP) {  // no longer a directory: remove it as it now is
    return r.record(path, unlinkUnlocking(directory, name, path, false));
  }
  if (rc) return r.record(path, rc);
  struct stat st;
  if ((rc = fs_->statAt(fd.get(), "", &st))) return r.record(path, rc);
  if (st.st_dev != r.device) return r.record(path, EXDEV);
  removeDirectoryContents(r, fd.get(), path, depth);
  fd.reset();
  rc = unlinkUnlocking(directory, name, path, true);
  if (rc == ENOTDIR) rc = unlinkUnlocking(directory, name, path, false);  // swapped meanwhile
  r.record(path, rc);
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
  removeEntry(r, parent.get(), name, path, S_ISDIR(st.st_mode), 0);
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
  VSASetError(error, VSAFileManagerFail(rc, "removeFileAtURL", "unlink of %@ failed: %s", path,
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

// Copies data, extended attributes (ACLs included), owner and mode, never
// following links. Returns 0 or the first errno.
int VSAFileManager::copyTree(const std::string& from, const std::string& to, std::string* failed) {
  struct stat st;
  if (int rc = fs_->lstat(from, &st)) return *failed = from, rc;
  int rc = 0;
  if (S_ISDIR(st.st_mode)) {
    if ((rc = fs_->mkdir(to, 0700))) return *failed = to, rc;
    std::vector<VSADirectoryEntry> entries;
    if ((rc = fs_->readDirectory(from, &entries))) return *failed = from, rc;
    for (const auto& e : entries)
      if ((rc = copyTree(VSAPathJoin(from, e.name), VSAPathJoin(to, e.name), failed))) return rc;
  } else if (S_ISLNK(st.st_mode)) {
    std::string target;
    if ((rc = fs_->readlink(from, &target)) || (rc = fs_->symlink(target, to)))
      return *failed = from, rc;
    fs_->lchown(to, st.st_uid, st.st_gid);
    return 0;
  } else if (S_ISREG(st.st_mode)) {
    if ((rc = fs_->copyData(from, to, 0600))) return *failed = from, rc;
  } else {
    return 0;  // sockets, fifos and devices are not container content
  }
  if ((rc = fs_->lchown(to, st.st_uid, st.st_gid))) return *failed = to, rc;
  if ((rc = fs_->chmod(to, st.st_mode & 07777))) return *failed = to, rc;
  std::vector<std::string> names;
  if (fs_->listxattr(from, &names) == 0) {
    for (const auto& name : names) {
      std::string value;
      if (fs_->getxattr(from, name, &value) != 0) continue;
      if ((rc = fs_->setxattr(to, name, value)) && rc != ENOTSUP) return *failed = to, rc;
    }
  }
  return 0;
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
