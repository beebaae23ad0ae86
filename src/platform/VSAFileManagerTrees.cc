// Whole-tree operations of VSAFileManager: walking, removal, copying,
// ownership and ACL normalisation, disk usage.
#include <cstring>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "platform/VSAFileManager.h"
#include "platform/VSAFileManagerErrors.h"

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

bool VSAFileManager::walk(const std::string& path, const struct stat& st, dev_t device,
                          const WalkBlock& block, std::string* failure, int* failureErrno) {
  if (!S_ISDIR(st.st_mode)) return block(path, st, WalkPhase::Item);
  if (!block(path, st, WalkPhase::Directory)) return false;
  if (st.st_dev == device) {  // stay on one device: do not descend into mounts
    std::vector<VSADirectoryEntry> entries;
    if (int rc = fs_->readDirectory(path, &entries)) {
      *failure = path;
      *failureErrno = rc;
      return false;
    }
    for (const auto& e : entries) {
      std::string child = VSAPathJoin(path, e.name);
      struct stat cst;
      if (int rc = fs_->lstat(child, &cst)) {
        *failure = child;
        *failureErrno = rc;
        return false;
      }
      if (!walk(child, cst, device, block, failure, failureErrno)) return false;
    }
  }
  return block(path, st, WalkPhase::DirectoryEnd);
}

bool VSAFileManager::traverseDirectory(const std::string& path, VSAErrorRef* error,
                                       const WalkBlock& block) {
  struct stat st;
  if (int rc = fs_->lstat(path, &st)) {
    VSASetError(error,
                VSAFileManagerFail(rc, "traverseDirectory", "fts_open failed for %s with error %s",
                                   path, std::strerror(rc)));
    return false;
  }
  std::string failedPath;
  int failedErrno = 0;
  size_t entries = 0;
  bool completed = walk(
      path, st, st.st_dev,
      [&](const std::string& p, const struct stat& s, WalkPhase w) {
        ++entries;
        return block(p, s, w);
      },
      &failedPath, &failedErrno);
  VSALogIn(VSALogCategory::FS, kVSALogDebug, "TraversingDirectory", "%zu entries under %s", entries,
           path);
  if (failedErrno) {
    VSASetError(error, VSAFileManagerFail(failedErrno, "traverseDirectory", "Error for path %s: %s",
                                          path, std::strerror(failedErrno)));
    return false;
  }
  (void)completed;  // a walk stopped by the block is not an error
  return true;
}

int VSAFileManager::removeImmutable(const std::string& path, bool directory) {
  int flags = 0;
  if (int rc = fs_->getFlags(path, &flags)) {
    VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
             "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path, std::strerror(rc));
    return EPERM;
  }
  if (!(flags & VSAFileSystem::kImmutableFlag)) return EPERM;
  if (int rc = fs_->setFlags(path, flags & ~VSAFileSystem::kImmutableFlag)) {
    VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Failed to lchflags %s: %s", path,
             std::strerror(rc));
    return rc;
  }
  VSALogIn(VSALogCategory::FS, kVSALogNotice, kOrigin, "Unset UF_IMMUTABLE on %s", path);
  int rc = directory ? fs_->rmdir(path) : fs_->unlink(path);
  if (rc)
    VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "unlink of %s failed: %s", path,
             std::strerror(rc));
  return rc;
}

// Removes a tree depth first, going on past errors; the first error is kept
// in `slot`. An item that refuses with EPERM because of the immutable flag
// (its own, or its directory's for the children) is unlocked and removed.
void VSAFileManager::removeTree(const std::string& path, const struct stat* st, int* slot) {
  auto record = [&](const std::string& p, int rc) {
    if (rc == 0 || rc == ENOENT) return;
    VSALogIn(VSALogCategory::FS, kVSALogError, "_removefile_error_callback",
             "removefile hit error for %s : %s", p, std::strerror(rc));
    if (*slot == 0) *slot = rc;
  };
  bool directory = st ? S_ISDIR(st->st_mode) : false;
  if (directory) {
    std::vector<VSADirectoryEntry> entries;
    int rc = fs_->readDirectory(path, &entries);
    if (rc) {
      record(path, rc);
    }
    for (const auto& e : entries) {
      std::string child = VSAPathJoin(path, e.name);
      if (e.type == VSADirectoryEntry::Type::Directory) {
        struct stat cst;
        cst.st_mode = S_IFDIR;
        removeTree(child, &cst, slot);
      } else {
        int urc = fs_->unlink(child);
        if (urc == EPERM) {
          // The directory may be the immutable one.
          int dflags = 0;
          if (fs_->getFlags(path, &dflags) == 0 && (dflags & VSAFileSystem::kImmutableFlag)) {
            fs_->setFlags(path, dflags & ~VSAFileSystem::kImmutableFlag);
            VSALogIn(VSALogCategory::FS, kVSALogNotice, kOrigin, "Unset UF_IMMUTABLE on %s", path);
            urc = fs_->unlink(child);
          }
          if (urc == EPERM) urc = removeImmutable(child, false);
        }
        record(child, urc);
      }
    }
  }
  int rc = directory ? fs_->rmdir(path) : fs_->unlink(path);
  if (rc == EPERM) rc = removeImmutable(path, directory);
  record(path, rc);
}

bool VSAFileManager::removeItemAtURL(const std::string& path, VSAErrorRef* error) {
  if (path.empty()) {
    VSASetError(error, VSAFileManagerFail(EFAULT, "removeItemAtURL",
                                          "nil url passed to -removeItemAtURL:error:"));
    return false;
  }
  struct stat st;
  int rc = fs_->lstat(path, &st);
  if (rc == ENOENT) return true;
  if (rc != 0) {
    VSASetError(error, VSAFileManagerFail(rc, "removeItemAtURL", "removefile of %@ failed: %s",
                                          path, std::strerror(rc)));
    return false;
  }
  int slot = 0;
  removeTree(path, &st, &slot);
  if (slot != 0) {
    VSASetError(error, VSAFileManagerFail(slot, "removeItemAtURL", "removefile of %@ failed: %s",
                                          path, std::strerror(slot)));
    return false;
  }
  return true;
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
  auto normalise = [&](const std::string& p, const struct stat& s, bool compareGID) {
    if (s.st_uid != uid || (compareGID && s.st_gid != gid)) {
      if (int rc = fs_->lchown(p, uid, gid))
        VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Could not chown %s: %s", p,
                 std::strerror(rc));
    }
    if (S_ISLNK(s.st_mode)) return;
    mode_t mode = S_ISDIR(s.st_mode) || (s.st_mode & 0111) ? 0755 : 0644;
    if (int rc = fs_->chmod(p, mode))
      VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Could not chmod %s: %s", p,
               std::strerror(rc));
  };
  bool ok =
      traverseDirectory(path, error, [&](const std::string& p, const struct stat& s, WalkPhase w) {
        if (p != path && w != WalkPhase::DirectoryEnd && !holdsMetadata(p)) normalise(p, s, true);
        return true;
      });
  if (!ok) return false;
  struct stat root;
  if (int rc = fs_->lstat(path, &root)) {
    VSASetError(error, VSAFileManagerFail(rc, "standardizeOwnershipAtURL", "Could not stat %s: %s",
                                          path, std::strerror(rc)));
    return false;
  }
  normalise(path, root, false);
  return true;
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
  auto gid = systemUsersGroup(error);
  if (!gid) return false;
  if (int rc = fs_->setSystemContainerACL(path, VSASystemContainerACL::TopLevel, *gid)) {
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
  return traverseDirectory(
      path, error, [&](const std::string& p, const struct stat& s, WalkPhase w) {
        if (w == WalkPhase::DirectoryEnd || holdsMetadata(p)) return true;
        if (p == path && isSystemContainer && S_ISDIR(s.st_mode)) {
          if (int rc = fs_->setSystemContainerACL(p, VSASystemContainerACL::TopLevel, *gid))
            VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
                     "Failed to set top level ACL on dir %s: %s", p, std::strerror(rc));
          return true;
        }
        if (!S_ISLNK(s.st_mode)) {
          bool dir = S_ISDIR(s.st_mode);
          // The ACL also sets the owner, group and other permissions to none:
          // access to system containers comes from the "systemusers" entry alone.
          if (int rc = fs_->setSystemContainerACL(
                  p, dir ? VSASystemContainerACL::Directory : VSASystemContainerACL::File, *gid))
            VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin,
                     dir ? "Failed to set ACL on dir %s: %s" : "Failed to set ACL on file %s: %s",
                     p, std::strerror(rc));
        }
        if (int rc = fs_->lchown(p, kVSANobodyID, kVSANobodyID))
          VSALogIn(VSALogCategory::FS, kVSALogError, kOrigin, "Could not chown %s: %s", p,
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
  traverseDirectory(path, &error, [&](const std::string&, const struct stat& s, WalkPhase w) {
    if (w != WalkPhase::DirectoryEnd) {
      total += static_cast<uint64_t>(s.st_size);
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
