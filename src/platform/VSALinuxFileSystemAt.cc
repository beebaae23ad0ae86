// Descriptor-relative calls of VSALinuxFileSystem, and the resolution of a
// path without links that every path-based call goes through.
#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <linux/openat2.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/sendfile.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "base/VSAPathString.h"
#include "platform/VSALinuxFileSystem.h"

namespace {
int err(int rc) { return rc == 0 ? 0 : errno; }

// Opens component by component with O_NOFOLLOW, for kernels without openat2.
int openByComponents(const std::string& path, int flags, VSAUniqueFd* fd) {
  VSAUniqueFd current(
      ::open(path.rfind('/', 0) == 0 ? "/" : ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!current) return errno;
  std::vector<std::string> parts;
  for (size_t start = 0; start <= path.size();) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    if (end > start) parts.push_back(path.substr(start, end - start));
    start = end + 1;
  }
  if (parts.empty()) {
    VSAUniqueFd self(::openat(current.get(), ".", flags | O_CLOEXEC));
    if (!self) return errno;
    *fd = std::move(self);
    return 0;
  }
  for (size_t i = 0; i < parts.size(); ++i) {
    bool last = i + 1 == parts.size();
    int f = last ? flags | O_NOFOLLOW | O_CLOEXEC : O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    VSAUniqueFd next(::openat(current.get(), parts[i].c_str(), f));
    if (!next) return errno == ENOTDIR && !last ? ELOOP : errno;
    current = std::move(next);
  }
  *fd = std::move(current);
  return 0;
}

std::string aclText(VSASystemContainerACL kind, gid_t gid, bool inherited) {
  // The owner, owning group and others get nothing: access is granted by the
  // "systemusers" entry alone, and the mask is rwx so that the entry counts.
  // The top level lets members add files and directories but not list it;
  // on Linux adding needs search (x) as well as write. What a member creates
  // inherits the entry, under a mask the creation mode's group bits decide,
  // and stays its creator's (the inherited owner entry is rwx, cut down to
  // the creation mode by the kernel).
  std::string g = std::to_string(gid);
  if (inherited) return "u::rwx,g::---,o::---,m::rwx,g:" + g + ":rwx";
  if (kind == VSASystemContainerACL::TopLevel) return "u::---,g::---,o::---,m::rwx,g:" + g + ":-wx";
  return "u::---,g::---,o::---,m::rwx,g:" + g + ":rwx";
}

int setACL(const std::string& path, acl_type_t type, const std::string& text) {
  acl_t a = acl_from_text(text.c_str());
  if (!a) return errno;
  int rc = acl_set_file(path.c_str(), type, a) == 0 ? 0 : errno;
  acl_free(a);
  return rc;
}
}  // namespace

int VSALinuxFileSystem::openNoSymlinks(const std::string& path, int flags, VSAUniqueFd* fd) {
  struct open_how how {};
  how.flags = static_cast<uint64_t>(flags | O_CLOEXEC);
  how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  long r = ::syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how);
  if (r >= 0) {
    fd->reset(static_cast<int>(r));
    return 0;
  }
  if (errno != ENOSYS) return errno;
  return openByComponents(path, flags, fd);
}

int VSALinuxFileSystem::openParent(const std::string& path, VSAUniqueFd* dir, std::string* name) {
  *name = VSALastPathComponent(path);
  if (name->empty() || *name == "." || *name == "..") return EINVAL;
  std::string parent = VSADirectoryName(path);
  if (parent.empty()) parent = path.rfind('/', 0) == 0 ? "/" : ".";
  return openNoSymlinks(parent, O_PATH | O_DIRECTORY, dir);
}

std::string VSALinuxFileSystem::procPath(int dir, const std::string& name) {
  std::string p = "/proc/self/fd/" + std::to_string(dir);
  if (!name.empty()) p += "/" + name;
  return p;
}

int VSALinuxFileSystem::openDirectory(const std::string& path, int* fd) {
  VSAUniqueFd out;
  if (int rc = openNoSymlinks(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW, &out)) return rc;
  *fd = out.release();
  return 0;
}

int VSALinuxFileSystem::openDirectoryAt(int dir, const std::string& name, int* fd) {
  int out = ::openat(dir, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (out < 0) return errno;
  *fd = out;
  return 0;
}

int VSALinuxFileSystem::statAt(int dir, const std::string& name, struct stat* st) {
  if (name.empty()) return err(::fstatat(dir, "", st, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW));
  return err(::fstatat(dir, name.c_str(), st, AT_SYMLINK_NOFOLLOW));
}

int VSALinuxFileSystem::readDirectoryAt(int dir, std::vector<VSADirectoryEntry>* entries) {
  // A descriptor of its own: reading moves the directory's offset.
  int fd = ::openat(dir, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
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
    entry.inode = e->d_ino;
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
    errno = 0;
  }
  int e = errno;
  closedir(d);
  return e;
}

int VSALinuxFileSystem::mkdirAt(int dir, const std::string& name, mode_t mode) {
  return err(::mkdirat(dir, name.c_str(), mode));
}

int VSALinuxFileSystem::unlinkAt(int dir, const std::string& name, bool directory) {
  return err(::unlinkat(dir, name.c_str(), directory ? AT_REMOVEDIR : 0));
}

int VSALinuxFileSystem::renameAt(int fromDir, const std::string& fromName, int toDir,
                                 const std::string& toName) {
  if (::renameat2(fromDir, fromName.c_str(), toDir, toName.c_str(), RENAME_NOREPLACE) != 0) {
    if (errno != EINVAL && errno != ENOSYS) return errno;
    // A file system without the flag: the caller's directories are its own,
    // so a look first is as good.
    struct stat st;
    if (::fstatat(toDir, toName.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) return EEXIST;
    if (::renameat(fromDir, fromName.c_str(), toDir, toName.c_str()) != 0) return errno;
  }
  syncDirectory(toDir);
  return 0;
}

int VSALinuxFileSystem::chownAt(int dir, const std::string& name, uid_t uid, gid_t gid) {
  if (name.empty()) return err(::fchownat(dir, "", uid, gid, AT_EMPTY_PATH));
  return err(::fchownat(dir, name.c_str(), uid, gid, AT_SYMLINK_NOFOLLOW));
}

int VSALinuxFileSystem::chmodAt(int dir, const std::string& name, mode_t mode) {
  // Through an O_PATH descriptor of the item itself: a link has no mode of
  // its own and is left alone; nothing is followed.
  VSAUniqueFd item(
      ::openat(dir, name.empty() ? "." : name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!item) return errno;
  struct stat st;
  if (::fstat(item.get(), &st) != 0) return errno;
  if (S_ISLNK(st.st_mode)) return 0;
  return err(::chmod(procPath(item.get(), "").c_str(), mode));
}

int VSALinuxFileSystem::openForIoctl(int dir, const std::string& name, VSAUniqueFd* fd) {
  VSAUniqueFd item(
      ::openat(dir, name.empty() ? "." : name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!item) return errno;
  struct stat st;
  if (::fstat(item.get(), &st) != 0) return errno;
  // Opening a device or a FIFO could block or have effects of its own.
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) return ENOTTY;
  int real = ::open(procPath(item.get(), "").c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
  if (real < 0) return errno;
  fd->reset(real);
  return 0;
}

int VSALinuxFileSystem::getFlagsAt(int dir, const std::string& name, int* flags) {
  VSAUniqueFd fd;
  if (int rc = openForIoctl(dir, name, &fd)) return rc;
  return ioctl(fd.get(), FS_IOC_GETFLAGS, flags) == 0 ? 0 : errno;
}

int VSALinuxFileSystem::setFlagsAt(int dir, const std::string& name, int flags) {
  VSAUniqueFd fd;
  if (int rc = openForIoctl(dir, name, &fd)) return rc;
  return ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) == 0 ? 0 : errno;
}

int VSALinuxFileSystem::setSystemContainerACLAt(int dir, const std::string& name,
                                                VSASystemContainerACL kind, gid_t gid) {
  VSAUniqueFd item(
      ::openat(dir, name.empty() ? "." : name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!item) return errno;
  struct stat st;
  if (::fstat(item.get(), &st) != 0) return errno;
  if (S_ISLNK(st.st_mode)) return ELOOP;
  std::string path = procPath(item.get(), "");
  if (int rc = setACL(path, ACL_TYPE_ACCESS, aclText(kind, gid, false))) return rc;
  if (kind == VSASystemContainerACL::File || !S_ISDIR(st.st_mode)) return 0;
  return setACL(path, ACL_TYPE_DEFAULT, aclText(kind, gid, true));  // inherited by new children
}

int VSALinuxFileSystem::getProtectionClassAt(int dir, const std::string& name,
                                             int* protectionClass) {
  char buf[32];
  // An empty name follows /proc's link to the directory itself.
  std::string path = procPath(dir, name);
  ssize_t n = name.empty()
                  ? ::getxattr(path.c_str(), kVSAProtectionClassXattr, buf, sizeof buf - 1)
                  : ::lgetxattr(path.c_str(), kVSAProtectionClassXattr, buf, sizeof buf - 1);
  if (n < 0) {
    if (errno != ENODATA) return errno;
    *protectionClass = 0;
    return 0;
  }
  buf[n] = 0;
  *protectionClass = std::atoi(buf);
  return 0;
}

int VSALinuxFileSystem::setProtectionClassAt(int dir, const std::string& name,
                                             int protectionClass) {
  int current = 0;
  if (int rc = getProtectionClassAt(dir, name, &current)) return rc;
  if (current >= 1 && current <= 3 && isLocked_ && isLocked_()) return kDeviceLockedError;
  std::string value = std::to_string(protectionClass);
  std::string path = procPath(dir, name);
  if (name.empty())
    return err(::setxattr(path.c_str(), kVSAProtectionClassXattr, value.data(), value.size(), 0));
  return err(::lsetxattr(path.c_str(), kVSAProtectionClassXattr, value.data(), value.size(), 0));
}

int VSALinuxFileSystem::syncDirectory(int dir) {
  // An O_PATH descriptor cannot be synced: reopen the directory itself.
  VSAUniqueFd real(::openat(dir, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!real) return errno;
  return err(::fsync(real.get()));
}

namespace {
// Copies the rest of `in` to `out`: a clone where the file system shares
// extents, else a copy in the kernel.
int copyBytes(int in, int out) {
  if (ioctl(out, FICLONE, in) == 0) return 0;
  for (;;) {
    ssize_t n = copy_file_range(in, nullptr, out, nullptr, 1 << 30, 0);
    if (n > 0) continue;
    if (n == 0) return 0;
    if (errno == EINTR) continue;
    if (errno != EXDEV && errno != ENOSYS && errno != EINVAL) return errno;
    off_t off = 0;
    struct stat st;
    if (fstat(in, &st) != 0) return errno;
    while (off < st.st_size) {
      ssize_t s = sendfile(out, in, &off, st.st_size - off);
      if (s <= 0) return s < 0 ? errno : EIO;
    }
    return 0;
  }
}
}  // namespace

int VSALinuxFileSystem::copyDataAt(int fromDir, const std::string& fromName, int toDir,
                                   const std::string& toName, mode_t mode) {
  VSAUniqueFd in(
      ::openat(fromDir, fromName.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!in) return errno;
  struct stat st;
  if (::fstat(in.get(), &st) != 0) return errno;
  if (!S_ISREG(st.st_mode)) return EINVAL;
  int out =
      ::openat(toDir, toName.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
  if (out < 0) return errno;
  int rc = copyBytes(in.get(), out);
  // Copies land in staging and are committed by a rename: data not yet on
  // disk would come back empty after a power loss, under the committed name.
  if (rc == 0 && ::fsync(out) != 0) rc = errno;
  if (::close(out) != 0 && rc == 0) rc = errno;
  if (rc != 0) ::unlinkat(toDir, toName.c_str(), 0);
  return rc;
}

int VSALinuxFileSystem::readlinkAt(int dir, const std::string& name, std::string* target) {
  char buf[1024];
  ssize_t n = ::readlinkat(dir, name.c_str(), buf, sizeof buf);
  if (n < 0) return errno;
  if (static_cast<size_t>(n) >= sizeof buf) return ENAMETOOLONG;
  target->assign(buf, n);
  return 0;
}

int VSALinuxFileSystem::symlinkAt(const std::string& target, int dir, const std::string& name) {
  return err(::symlinkat(target.c_str(), dir, name.c_str()));
}

// An empty name follows /proc's link to the directory itself; otherwise the
// item is reached through its directory and not followed.
int VSALinuxFileSystem::listxattrAt(int dir, const std::string& name,
                                    std::vector<std::string>* names) {
  char buf[65536];
  std::string path = procPath(dir, name);
  ssize_t n = name.empty() ? ::listxattr(path.c_str(), buf, sizeof buf)
                           : ::llistxattr(path.c_str(), buf, sizeof buf);
  if (n < 0) return errno;
  for (ssize_t i = 0; i < n;) {
    std::string attribute(buf + i);
    i += attribute.size() + 1;
    if (!attribute.empty()) names->push_back(std::move(attribute));
  }
  return 0;
}

int VSALinuxFileSystem::getxattrAt(int dir, const std::string& name, const std::string& attribute,
                                   std::string* value) {
  char buf[65536];
  std::string path = procPath(dir, name);
  ssize_t n = name.empty() ? ::getxattr(path.c_str(), attribute.c_str(), buf, sizeof buf)
                           : ::lgetxattr(path.c_str(), attribute.c_str(), buf, sizeof buf);
  if (n < 0) return errno;
  value->assign(buf, n);
  return 0;
}

int VSALinuxFileSystem::setxattrAt(int dir, const std::string& name, const std::string& attribute,
                                   const std::string& value) {
  std::string path = procPath(dir, name);
  if (name.empty())
    return err(::setxattr(path.c_str(), attribute.c_str(), value.data(), value.size(), 0));
  return err(::lsetxattr(path.c_str(), attribute.c_str(), value.data(), value.size(), 0));
}

int VSARenameWithoutLinks(VSAFileSystem& fs, const std::string& from, const std::string& to) {
  int fromDir = -1, toDir = -1;
  if (int rc = fs.openDirectory(VSADirectoryName(from), &fromDir)) return rc;
  VSAUniqueFd fromOwned(fromDir);
  if (int rc = fs.openDirectory(VSADirectoryName(to), &toDir)) return rc;
  VSAUniqueFd toOwned(toDir);
  return fs.renameAt(fromDir, VSALastPathComponent(from), toDir, VSALastPathComponent(to));
}

int VSARemoveDirectoryWithoutLinks(VSAFileSystem& fs, const std::string& path) {
  int dir = -1;
  if (int rc = fs.openDirectory(VSADirectoryName(path), &dir)) return rc;
  VSAUniqueFd owned(dir);
  return fs.unlinkAt(dir, VSALastPathComponent(path), true);
}
