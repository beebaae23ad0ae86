#include "platform/VSALinuxFileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/quota.h>
#include <sys/sendfile.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

#include "base/VSAPlist.h"

namespace {
int err(int rc) { return rc == 0 ? 0 : errno; }

// Opens an item for an ioctl without following a final link.
int openNoFollow(const std::string& path) {
  return ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
}
}  // namespace

const char* VSAFileSystem::opName(Op op) {
  static const char* names[] = {
      "lstat",    "mkdir",    "chown",    "chmod",           "rename",   "readlink",  "realpath",
      "unlink",   "rmdir",    "readdir",  "getxattr",        "setxattr", "listxattr", "getflags",
      "setflags", "copydata", "symlink",  "writefile",       "readfile", "mkdtemp",   "setacl",
      "getclass", "setclass", "dirstats", "maintaindirstats"};
  return names[static_cast<int>(op)];
}

VSALinuxFileSystem::VSALinuxFileSystem(std::function<bool()> isLocked)
    : isLocked_(std::move(isLocked)) {}

int VSALinuxFileSystem::lstat(const std::string& path, struct stat* st) {
  return err(::lstat(path.c_str(), st));
}

int VSALinuxFileSystem::mkdir(const std::string& path, mode_t mode) {
  return err(::mkdir(path.c_str(), mode));
}

int VSALinuxFileSystem::lchown(const std::string& path, uid_t uid, gid_t gid) {
  return err(::lchown(path.c_str(), uid, gid));
}

int VSALinuxFileSystem::chmod(const std::string& path, mode_t mode) {
  struct stat st;
  if (::lstat(path.c_str(), &st) != 0) return errno;
  if (S_ISLNK(st.st_mode)) return 0;  // a link has no mode of its own on Linux
  return err(::chmod(path.c_str(), mode));
}

int VSALinuxFileSystem::rename(const std::string& from, const std::string& to) {
  return err(::rename(from.c_str(), to.c_str()));
}

int VSALinuxFileSystem::readlink(const std::string& path, std::string* target) {
  char buf[1024];
  ssize_t n = ::readlink(path.c_str(), buf, sizeof buf);
  if (n < 0) return errno;
  if (static_cast<size_t>(n) >= sizeof buf) return ENAMETOOLONG;
  target->assign(buf, n);
  return 0;
}

int VSALinuxFileSystem::realpath(const std::string& path, std::string* resolved) {
  char buf[PATH_MAX];
  if (!::realpath(path.c_str(), buf)) return errno;
  *resolved = buf;
  return 0;
}

int VSALinuxFileSystem::unlink(const std::string& path) { return err(::unlink(path.c_str())); }
int VSALinuxFileSystem::rmdir(const std::string& path) { return err(::rmdir(path.c_str())); }

int VSALinuxFileSystem::readDirectory(const std::string& path,
                                      std::vector<VSADirectoryEntry>* entries) {
  int fd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return errno;
  DIR* d = fdopendir(fd);
  if (!d) {
    int e = errno;
    ::close(fd);
    return e;
  }
  errno = 0;
  while (struct dirent* e = ::readdir(d)) {
    if (std::strcmp(e->d_name, ".") == 0 || std::strcmp(e->d_name, "..") == 0) continue;
    VSADirectoryEntry entry;
    entry.name = e->d_name;
    unsigned char type = e->d_type;
    if (type == DT_UNKNOWN) {
      struct stat st;
      if (fstatat(fd, e->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0)
        type = S_ISDIR(st.st_mode)   ? DT_DIR
               : S_ISLNK(st.st_mode) ? DT_LNK
               : S_ISREG(st.st_mode) ? DT_REG
                                     : DT_UNKNOWN;
    }
    entry.type = type == DT_DIR   ? VSADirectoryEntry::Type::Directory
                 : type == DT_REG ? VSADirectoryEntry::Type::File
                 : type == DT_LNK ? VSADirectoryEntry::Type::Symlink
                                  : VSADirectoryEntry::Type::Other;
    entries->push_back(std::move(entry));
  }
  int e = errno;
  closedir(d);
  return e;
}

int VSALinuxFileSystem::getxattr(const std::string& path, const std::string& name,
                                 std::string* value) {
  char buf[65536];
  ssize_t n = ::lgetxattr(path.c_str(), name.c_str(), buf, sizeof buf);
  if (n < 0) return errno;
  value->assign(buf, n);
  return 0;
}

int VSALinuxFileSystem::setxattr(const std::string& path, const std::string& name,
                                 const std::string& value) {
  return err(::lsetxattr(path.c_str(), name.c_str(), value.data(), value.size(), 0));
}

int VSALinuxFileSystem::listxattr(const std::string& path, std::vector<std::string>* names) {
  char buf[65536];
  ssize_t n = ::llistxattr(path.c_str(), buf, sizeof buf);
  if (n < 0) return errno;
  for (ssize_t i = 0; i < n;) {
    std::string name(buf + i);
    i += name.size() + 1;
    if (!name.empty()) names->push_back(std::move(name));
  }
  return 0;
}

int VSALinuxFileSystem::getFlags(const std::string& path, int* flags) {
  int fd = openNoFollow(path);
  if (fd < 0) return errno;
  int rc = ioctl(fd, FS_IOC_GETFLAGS, flags) == 0 ? 0 : errno;
  ::close(fd);
  return rc;
}

int VSALinuxFileSystem::setFlags(const std::string& path, int flags) {
  int fd = openNoFollow(path);
  if (fd < 0) return errno;
  int rc = ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0 ? 0 : errno;
  ::close(fd);
  return rc;
}

int VSALinuxFileSystem::copyData(const std::string& from, const std::string& to, mode_t mode) {
  int in = ::open(from.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  if (in < 0) return errno;
  int out = ::open(to.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
  if (out < 0) {
    int e = errno;
    ::close(in);
    return e;
  }
  int rc = 0;
  if (ioctl(out, FICLONE, in) != 0) {  // no reflinks here: copy the bytes in the kernel
    for (;;) {
      ssize_t n = copy_file_range(in, nullptr, out, nullptr, 1 << 30, 0);
      if (n > 0) continue;
      if (n == 0) break;
      if (errno == EINTR) continue;
      if (errno == EXDEV || errno == ENOSYS || errno == EINVAL) {
        off_t off = 0;
        struct stat st;
        fstat(in, &st);
        while (off < st.st_size) {
          ssize_t s = sendfile(out, in, &off, st.st_size - off);
          if (s <= 0) {
            rc = s < 0 ? errno : EIO;
            break;
          }
        }
        break;
      }
      rc = errno;
      break;
    }
  }
  ::close(in);
  if (::close(out) != 0 && rc == 0) rc = errno;
  if (rc != 0) ::unlink(to.c_str());
  return rc;
}

int VSALinuxFileSystem::symlink(const std::string& target, const std::string& path) {
  return err(::symlink(target.c_str(), path.c_str()));
}

int VSALinuxFileSystem::writeFile(const std::string& path, const std::vector<uint8_t>& bytes,
                                  mode_t mode) {
  int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, mode);
  if (fd < 0) return errno;
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

int VSALinuxFileSystem::mkdtemp(const std::string& templ, std::string* path) {
  std::string buf = templ;
  if (!::mkdtemp(buf.data())) return errno;
  *path = buf;
  return 0;
}

int VSALinuxFileSystem::setSystemContainerACL(const std::string& path, VSASystemContainerACL kind,
                                              gid_t gid) {
  // The owner, owning group and others get nothing: access is granted by the
  // "systemusers" entry alone (the mask keeps that entry effective).
  std::string g = std::to_string(gid);
  std::string all = "u::---,g::---,o::---,m::rwx,g:" + g + ":rwx";
  std::string access =
      kind == VSASystemContainerACL::TopLevel ? "u::---,g::---,o::---,m::rwx,g:" + g + ":-w-" : all;
  acl_t a = acl_from_text(access.c_str());
  if (!a) return errno;
  int rc = acl_set_file(path.c_str(), ACL_TYPE_ACCESS, a) == 0 ? 0 : errno;
  acl_free(a);
  if (rc != 0 || kind == VSASystemContainerACL::File) return rc;
  acl_t d = acl_from_text(all.c_str());  // inherited by new children
  if (!d) return errno;
  rc = acl_set_file(path.c_str(), ACL_TYPE_DEFAULT, d) == 0 ? 0 : errno;
  acl_free(d);
  return rc;
}

int VSALinuxFileSystem::getProtectionClass(const std::string& path, int* protectionClass) {
  std::string value;
  int rc = getxattr(path, kVSAProtectionClassXattr, &value);
  if (rc == ENODATA) {
    *protectionClass = 0;
    return 0;
  }
  if (rc != 0) return rc;
  *protectionClass = std::atoi(value.c_str());
  return 0;
}

int VSALinuxFileSystem::setProtectionClass(const std::string& path, int protectionClass) {
  int current = 0;
  int rc = getProtectionClass(path, &current);
  if (rc != 0) return rc;
  if (current >= 1 && current <= 3 && isLocked_ && isLocked_()) return kDeviceLockedError;
  return setxattr(path, kVSAProtectionClassXattr, std::to_string(protectionClass));
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
