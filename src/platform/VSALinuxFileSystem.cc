#include "platform/VSALinuxFileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/quota.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

#include "base/VSAPathString.h"
#include "base/VSAPlist.h"

namespace {
// Opens an item for an ioctl without following a link.
int openNoFollow(const std::string& path) {
  VSAUniqueFd fd;
  if (int rc = VSALinuxFileSystem::openNoSymlinks(
          path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY, &fd)) {
    errno = rc;
    return -1;
  }
  return fd.release();
}
}  // namespace

const char* VSAFileSystem::opName(Op op) {
  static const char* names[] = {"lstat",    "mkdir",    "chown",     "chmod",    "rename",
                                "readlink", "realpath", "unlink",    "rmdir",    "readdir",
                                "getxattr", "setxattr", "listxattr", "getflags", "setflags",
                                "copydata", "symlink",  "writefile", "readfile", "mkdtemp",
                                "setacl",   "getclass", "setclass",  "dirstats", "maintaindirstats",
                                "opendir",  "syncdir"};
  return names[static_cast<int>(op)];
}

VSALinuxFileSystem::VSALinuxFileSystem(std::function<bool()> isLocked)
    : isLocked_(std::move(isLocked)) {}

// Runs `call(directory, name)` on the directory holding `path`.
template <typename F>
int VSALinuxFileSystem::atParent(const std::string& path, F&& call) {
  VSAUniqueFd dir;
  std::string name;
  if (int rc = openParent(path, &dir, &name)) return rc;
  return call(dir.get(), name);
}

int VSALinuxFileSystem::lstat(const std::string& path, struct stat* st) {
  return atParent(path, [&](int dir, const std::string& name) { return statAt(dir, name, st); });
}

int VSALinuxFileSystem::exists(const std::string& path) {
  std::string_view name = VSALastPathComponentView(path);
  if (name.empty() || name == "." || name == ".." || path.back() == '/') {
    struct stat st;
    return lstat(path, &st);  // the same refusals and trailing-slash meaning as lstat
  }
  // O_PATH with O_NOFOLLOW opens a final link itself, as lstat reports it; a
  // link before it fails the open as it fails the walk to the parent.
  VSAUniqueFd fd;
  return openNoSymlinks(path, O_PATH | O_NOFOLLOW, &fd);
}

int VSALinuxFileSystem::mkdir(const std::string& path, mode_t mode) {
  return atParent(path, [&](int dir, const std::string& name) { return mkdirAt(dir, name, mode); });
}

int VSALinuxFileSystem::lchown(const std::string& path, uid_t uid, gid_t gid) {
  return atParent(path,
                  [&](int dir, const std::string& name) { return chownAt(dir, name, uid, gid); });
}

int VSALinuxFileSystem::chmod(const std::string& path, mode_t mode) {
  return atParent(path, [&](int dir, const std::string& name) { return chmodAt(dir, name, mode); });
}

int VSALinuxFileSystem::rename(const std::string& from, const std::string& to) {
  VSAUniqueFd fromDir, toDir;
  std::string fromName, toName;
  if (int rc = openParent(from, &fromDir, &fromName)) return rc;
  if (int rc = openParent(to, &toDir, &toName)) return rc;
  if (::renameat(fromDir.get(), fromName.c_str(), toDir.get(), toName.c_str()) != 0) return errno;
  // The rename has taken effect; a failing sync means a failing disk, which
  // the next call reports.
  syncDirectory(toDir.get());
  return 0;
}

int VSALinuxFileSystem::renameWithoutSync(const std::string& from, const std::string& to) {
  VSAUniqueFd fromDir, toDir;
  std::string fromName, toName;
  if (int rc = openParent(from, &fromDir, &fromName)) return rc;
  if (int rc = openParent(to, &toDir, &toName)) return rc;
  return ::renameat(fromDir.get(), fromName.c_str(), toDir.get(), toName.c_str()) != 0 ? errno : 0;
}

int VSALinuxFileSystem::exchange(const std::string& a, const std::string& b) {
  VSAUniqueFd aDir, bDir;
  std::string aName, bName;
  if (int rc = openParent(a, &aDir, &aName)) return rc;
  if (int rc = openParent(b, &bDir, &bName)) return rc;
  if (::renameat2(aDir.get(), aName.c_str(), bDir.get(), bName.c_str(), RENAME_EXCHANGE) != 0)
    return errno;
  syncDirectory(aDir.get());
  syncDirectory(bDir.get());
  return 0;
}

int VSALinuxFileSystem::readlink(const std::string& path, std::string* target) {
  return atParent(path,
                  [&](int dir, const std::string& name) { return readlinkAt(dir, name, target); });
}

// The one call that follows links: it answers where a path really leads.
int VSALinuxFileSystem::realpath(const std::string& path, std::string* resolved) {
  char buf[PATH_MAX];
  if (!::realpath(path.c_str(), buf)) return errno;
  *resolved = buf;
  return 0;
}

int VSALinuxFileSystem::unlink(const std::string& path) {
  return atParent(path,
                  [&](int dir, const std::string& name) { return unlinkAt(dir, name, false); });
}

int VSALinuxFileSystem::rmdir(const std::string& path) {
  return atParent(path,
                  [&](int dir, const std::string& name) { return unlinkAt(dir, name, true); });
}

int VSALinuxFileSystem::readDirectory(const std::string& path,
                                      std::vector<VSADirectoryEntry>* entries) {
  VSAUniqueFd dir;
  if (int rc = openNoSymlinks(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW, &dir)) return rc;
  return readDirectoryAt(dir.get(), entries);
}

int VSALinuxFileSystem::getxattr(const std::string& path, const std::string& name,
                                 std::string* value) {
  return atParent(
      path, [&](int dir, const std::string& item) { return getxattrAt(dir, item, name, value); });
}

int VSALinuxFileSystem::getFlags(const std::string& path, int* flags) {
  return atParent(path,
                  [&](int dir, const std::string& name) { return getFlagsAt(dir, name, flags); });
}

int VSALinuxFileSystem::setFlags(const std::string& path, int flags) {
  return atParent(path,
                  [&](int dir, const std::string& name) { return setFlagsAt(dir, name, flags); });
}

int VSALinuxFileSystem::writeFile(const std::string& path, const std::vector<uint8_t>& bytes,
                                  mode_t mode) {
  VSAUniqueFd dir;
  std::string name;
  if (int rc = openParent(path, &dir, &name)) return rc;
  int fd = ::openat(dir.get(), name.c_str(),
                    O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, mode);
  if (fd < 0) return errno;
  struct stat st;
  if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    ::close(fd);
    return EINVAL;
  }
  size_t done = 0;
  int rc = 0;
  while (done < bytes.size()) {
    ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      rc = n < 0 ? errno : EIO;
      break;
    }
    done += n;
  }
  if (rc == 0 && fsync(fd) != 0) rc = errno;
  if (::close(fd) != 0 && rc == 0) rc = errno;
  return rc;
}

int VSALinuxFileSystem::readFile(const std::string& path, std::vector<uint8_t>* bytes,
                                 size_t maxSize) {
  // The bounded, non-blocking read shared with the property-list file helpers.
  return VSAReadRegularFile(path, maxSize, bytes);
}

int VSALinuxFileSystem::readFileAt(int dir, const std::string& path, std::vector<uint8_t>* bytes,
                                   size_t maxSize) {
  return VSAReadRegularFileAt(dir, path, maxSize, bytes);
}

int VSALinuxFileSystem::mkdtemp(const std::string& templ, std::string* path) {
  VSAUniqueFd dir;
  std::string name;
  if (int rc = openParent(templ, &dir, &name)) return rc;
  if (name.size() < 6 || name.compare(name.size() - 6, 6, "XXXXXX") != 0) return EINVAL;
  static const char alphabet[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
  for (int attempt = 0; attempt < 100; ++attempt) {
    unsigned char random[6];
    if (getentropy(random, sizeof random) != 0) return errno;
    for (int i = 0; i < 6; ++i) name[name.size() - 6 + i] = alphabet[random[i] % 62];
    if (::mkdirat(dir.get(), name.c_str(), 0700) == 0) {
      *path = VSAPathJoin(VSADirectoryName(templ), name);
      return 0;
    }
    if (errno != EEXIST) return errno;
  }
  return EEXIST;
}

int VSALinuxFileSystem::setSystemContainerACL(const std::string& path, VSASystemContainerACL kind,
                                              gid_t gid) {
  return atParent(path, [&](int dir, const std::string& name) {
    return setSystemContainerACLAt(dir, name, kind, gid);
  });
}

int VSALinuxFileSystem::getProtectionClass(const std::string& path, int* protectionClass) {
  return atParent(path, [&](int dir, const std::string& name) {
    return getProtectionClassAt(dir, name, protectionClass);
  });
}

int VSALinuxFileSystem::setProtectionClass(const std::string& path, int protectionClass) {
  return atParent(path, [&](int dir, const std::string& name) {
    return setProtectionClassAt(dir, name, protectionClass);
  });
}

namespace {
// The block device holding `path`, from the mount table.
std::string deviceOf(const std::string& path) {
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return {};
  std::ifstream in("/proc/self/mountinfo");
  std::string line;
  while (std::getline(in, line)) {
    std::istringstream fields(line);
    std::string id, parent, majmin;
    fields >> id >> parent >> majmin;
    unsigned maj = 0, min = 0;
    if (std::sscanf(majmin.c_str(), "%u:%u", &maj, &min) != 2) continue;
    if (makedev(maj, min) != st.st_dev) continue;
    size_t dash = line.find(" - ");
    if (dash == std::string::npos) continue;
    std::istringstream tail(line.substr(dash + 3));
    std::string type, source;
    tail >> type >> source;
    return source;
  }
  return {};
}
}  // namespace

int VSALinuxFileSystem::directoryStatistics(const std::string& path, uint64_t* bytes) {
  int fd = openNoFollow(path);
  if (fd < 0) return errno;
  struct fsxattr attr {};
  int rc = ioctl(fd, FS_IOC_FSGETXATTR, &attr) == 0 ? 0 : errno;
  ::close(fd);
  if (rc != 0) return rc;
  if (attr.fsx_projid == 0 || !(attr.fsx_xflags & FS_XFLAG_PROJINHERIT)) return ENODATA;
  std::string device = deviceOf(path);
  if (device.empty()) return ENODEV;
  struct dqblk quota {};
  if (quotactl(QCMD(Q_GETQUOTA, PRJQUOTA), device.c_str(), static_cast<int>(attr.fsx_projid),
               reinterpret_cast<caddr_t>(&quota)) != 0)
    return errno;
  *bytes = quota.dqb_curspace;
  return 0;
}

int VSALinuxFileSystem::maintainDirectoryStatistics(const std::string& path) {
  int fd = openNoFollow(path);
  if (fd < 0) return errno;
  struct stat st;
  struct fsxattr attr {};
  int rc = (fstat(fd, &st) == 0 && ioctl(fd, FS_IOC_FSGETXATTR, &attr) == 0) ? 0 : errno;
  if (rc == 0) {
    // The directory's inode number names its project: unique on this device.
    attr.fsx_projid = static_cast<uint32_t>(st.st_ino & 0x7FFFFFFF) | 1;
    attr.fsx_xflags |= FS_XFLAG_PROJINHERIT;
    rc = ioctl(fd, FS_IOC_FSSETXATTR, &attr) == 0 ? 0 : errno;
  }
  ::close(fd);
  return rc;
}
