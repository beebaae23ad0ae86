#include "platform/VSAPrivateFile.h"

#include <fcntl.h>
#include <sys/stat.h>

#include "platform/VSALinuxFileSystem.h"

int VSAMakeFileOwnerOnly(const std::string& path, bool create) {
  VSAUniqueFd fd;
  int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | (create ? O_CREAT : 0);
  int rc = 0;
  if (create) {
    // openat2 takes no creation mode through openNoSymlinks: find the
    // directory without links, then create the file in it.
    VSAUniqueFd dir;
    std::string name;
    if ((rc = VSALinuxFileSystem::openParent(path, &dir, &name))) return rc;
    fd.reset(::openat(dir.get(), name.c_str(), flags | O_CLOEXEC, 0600));
    if (!fd) return errno;
  } else {
    rc = VSALinuxFileSystem::openNoSymlinks(path, flags, &fd);
    if (rc == ENOENT) return 0;
    if (rc) return rc;
  }
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return errno;
  if (!S_ISREG(st.st_mode)) return EINVAL;
  if ((st.st_mode & 07777) != 0600 && ::fchmod(fd.get(), 0600) != 0) return errno;
  return 0;
}
