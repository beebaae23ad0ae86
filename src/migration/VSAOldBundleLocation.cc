#include "migration/VSAOldBundleLocation.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstring>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "model/VSAContainerClass.h"
#include "platform/VSAFileManager.h"
#include "platform/VSAUniqueFd.h"

namespace {
constexpr const char* kOrigin = "performSynchronousBuildUpgradeMigration";

// Why `st` is not an item of `type` that the installation made, or nothing.
const char* distrust(const struct stat& st, mode_t type) {
  if ((st.st_mode & S_IFMT) != type)
    return type == S_IFDIR ? "not a directory" : "not a regular file";
  uid_t owner = st.st_uid;
  if (owner != 0 && owner != geteuid() && owner != CONTAINER_INSTALLATION_UID)
    return "not owned by the installation";
  if (st.st_mode & 022) return "writable by others than its owner";
  return nullptr;
}

class OldBundleWalk {
 public:
  OldBundleWalk(VSAFileSystem& fs, VSAErrorRef* error) : fs_(fs), error_(error) {}

  bool run(const std::string& old, const std::string& target) {
    VSAUniqueFd from, to;
    if (!openTop(old, &from)) return true;  // nothing there, or nothing to trust
    int fd = -1;
    if (int rc = fs_.openDirectory(target, &fd)) return fail(rc, target);
    to.reset(fd);
    std::vector<VSADirectoryEntry> classes;
    if (int rc = fs_.readDirectoryAt(from.get(), &classes)) return fail(rc, old);
    for (const auto& entry : classes) {
      size_t before = left_;
      if (!moveClass(from.get(), to.get(), entry.name, VSAPathJoin(old, entry.name))) return false;
      if (left_ == before) fs_.unlinkAt(from.get(), entry.name, true);
    }
    if (left_ == 0) VSARemoveDirectoryWithoutLinks(fs_, old);
    return true;
  }

 private:
  void leave(const std::string& path, const char* why) {
    ++left_;
    VSALogIn(VSALogCategory::Startup, kVSALogError, kOrigin,
             "Leaving %@ in the old bundle location: %s", path, why);
  }

  bool fail(int rc, const std::string& path) {
    VSASetError(error_, VSAError::posix(rc, "migrateOldBundleLocation", __LINE__,
                                        VSAFormat("%@: %s", path, std::strerror(rc))));
    return false;
  }

  // Checks the directory open at `fd`; false (and logged) when it is not trusted.
  bool trusted(int fd, const std::string& path) {
    struct stat st {};
    if (int rc = fs_.statAt(fd, "", &st)) return leave(path, std::strerror(rc)), false;
    if (const char* why = distrust(st, S_IFDIR)) return leave(path, why), false;
    return true;
  }

  bool openTop(const std::string& old, VSAUniqueFd* out) {
    int fd = -1;
    if (int rc = fs_.openDirectory(old, &fd)) {
      if (rc != ENOENT) leave(old, std::strerror(rc));
      return false;
    }
    out->reset(fd);
    return trusted(fd, old);
  }

  bool openTrusted(int dir, const std::string& name, const std::string& path, VSAUniqueFd* out) {
    int fd = -1;
    if (int rc = fs_.openDirectoryAt(dir, name, &fd)) return leave(path, std::strerror(rc)), false;
    out->reset(fd);
    return trusted(fd, path);
  }

  // The class directory `name` of the target, made like the old one if missing.
  bool openTargetClass(int to, const std::string& name, int from, VSAUniqueFd* out) {
    int fd = -1;
    int rc = fs_.openDirectoryAt(to, name, &fd);
    if (rc == ENOENT) {
      struct stat st {};
      if ((rc = fs_.statAt(from, "", &st)) || (rc = fs_.mkdirAt(to, name, 0755)) ||
          (rc = fs_.chownAt(to, name, st.st_uid, st.st_gid)))
        return fail(rc, name);
      fs_.syncDirectory(to);
      rc = fs_.openDirectoryAt(to, name, &fd);
    }
    if (rc) return fail(rc, name);
    out->reset(fd);
    return true;
  }

  bool moveClass(int from, int to, const std::string& name, const std::string& path) {
    VSAUniqueFd source, target;
    if (!openTrusted(from, name, path, &source)) return true;
    std::vector<VSADirectoryEntry> containers;
    if (int rc = fs_.readDirectoryAt(source.get(), &containers)) return fail(rc, path);
    if (!openTargetClass(to, name, source.get(), &target)) return false;
    for (const auto& entry : containers) {
      std::string container = VSAPathJoin(path, entry.name);
      if (!movable(source.get(), entry.name, container)) continue;
      if (int rc = fs_.renameAt(source.get(), entry.name, target.get(), entry.name))
        return fail(rc, container);
    }
    return true;
  }

  // A container the installation made: a trusted directory whose metadata
  // file, when there is one, is a regular file the installation wrote.
  bool movable(int dir, const std::string& name, const std::string& path) {
    VSAUniqueFd container;
    if (!openTrusted(dir, name, path, &container)) return false;
    struct stat st {};
    int rc = fs_.statAt(container.get(), kVSAMetadataFileName, &st);
    if (rc == ENOENT) return true;
    const char* why = rc ? std::strerror(rc) : distrust(st, S_IFREG);
    if (why) leave(path, why);
    return why == nullptr;
  }

  VSAFileSystem& fs_;
  VSAErrorRef* error_;
  size_t left_ = 0;
};
}  // namespace

bool VSAMoveOldBundleLocation(VSAFileSystem& fs, const std::string& old, const std::string& target,
                              VSAErrorRef* error) {
  return OldBundleWalk(fs, error).run(old, target);
}
