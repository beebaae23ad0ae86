#include "platform/VSAListeningSocket.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>  // SD_LISTEN_FDS_START only
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "base/VSASystemdLibrary.h"

int VSABindListeningSocket(int fd, const std::string& path, mode_t mode, int backlog) {
  std::string temporary = path + "." + std::to_string(::getpid()) + ".new";
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  if (temporary.size() >= sizeof addr.sun_path) return ENAMETOOLONG;
  std::memcpy(addr.sun_path, temporary.c_str(), temporary.size() + 1);
  ::unlink(temporary.c_str());  // left by an earlier process of this pid
  int rc = 0;
  // Until listen() nothing can connect, so the mode is right before anyone can.
  if (::bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0 ||
      ::chmod(temporary.c_str(), mode) != 0 || ::listen(fd, backlog) != 0 ||
      ::rename(temporary.c_str(), path.c_str()) != 0)
    rc = errno;
  if (rc != 0) ::unlink(temporary.c_str());
  return rc;
}

int VSAActivatedListeningSocket(int type, const std::string& path) {
  const VSASystemdLibrary* systemd = VSASystemdLibrary::get();
  if (!systemd) return -1;
  int count = systemd->listenFds(0);  // the environment stays: each listener looks
  for (int fd = SD_LISTEN_FDS_START; fd < SD_LISTEN_FDS_START + count; ++fd)
    if (systemd->isSocketUnix(fd, type, 1, path.c_str(), 0) > 0) return fd;
  return -1;
}
