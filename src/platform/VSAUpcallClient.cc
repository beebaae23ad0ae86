#include "platform/VSAUpcallClient.h"

#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace {
bool fail(std::string* why, const std::string& what) {
  if (why) *why = what + ": " + std::strerror(errno);
  return false;
}
}  // namespace

VSAUpcallClient::~VSAUpcallClient() {
  if (fd_ >= 0) ::close(fd_);
}

bool VSAUpcallClient::connect(const std::string& socketPath, std::string* why) {
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  if (socketPath.size() >= sizeof addr.sun_path) {
    errno = ENAMETOOLONG;
    return fail(why, socketPath);
  }
  std::memcpy(addr.sun_path, socketPath.c_str(), socketPath.size() + 1);
  fd_ = ::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  if (fd_ < 0) return fail(why, "socket");
  if (::connect(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0)
    return fail(why, "connect to " + socketPath);
  return true;
}

bool VSAUpcallClient::call(const std::vector<uint8_t>& message, const std::vector<uint8_t>* memory,
                           std::vector<uint8_t>* reply,
                           std::optional<std::vector<uint8_t>>* replyMemory, std::string* why,
                           int timeoutMilliseconds) {
  int memfd = -1;
  if (memory) {
    memfd = ::memfd_create("vessa-upcall-request", MFD_CLOEXEC);
    if (memfd < 0) return fail(why, "memfd_create");
    if (!memory->empty() &&
        ::write(memfd, memory->data(), memory->size()) != static_cast<ssize_t>(memory->size())) {
      ::close(memfd);
      return fail(why, "write");
    }
  }
  struct iovec iov = {const_cast<uint8_t*>(message.data()), message.size()};
  alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
  struct msghdr msg = {};
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  if (memfd >= 0) {
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
    c->cmsg_level = SOL_SOCKET;
    c->cmsg_type = SCM_RIGHTS;
    c->cmsg_len = CMSG_LEN(sizeof(int));
    std::memcpy(CMSG_DATA(c), &memfd, sizeof(int));
  }
  ssize_t sent = ::sendmsg(fd_, &msg, MSG_NOSIGNAL);
  if (memfd >= 0) ::close(memfd);
  if (sent < 0) return fail(why, "sendmsg");

  struct pollfd p = {fd_, POLLIN, 0};
  if (::poll(&p, 1, timeoutMilliseconds) <= 0) {
    errno = ETIMEDOUT;
    return fail(why, "waiting for the reply");
  }
  reply->assign(256, 0);
  struct iovec in = {reply->data(), reply->size()};
  alignas(struct cmsghdr) char replyControl[CMSG_SPACE(sizeof(int) * 4)] = {};
  struct msghdr r = {};
  r.msg_iov = &in;
  r.msg_iovlen = 1;
  r.msg_control = replyControl;
  r.msg_controllen = sizeof replyControl;
  ssize_t n = ::recvmsg(fd_, &r, MSG_CMSG_CLOEXEC);
  if (n <= 0) {
    if (n == 0) errno = ECONNRESET;
    return fail(why, "recvmsg");
  }
  reply->resize(static_cast<size_t>(n));
  replyMemory->reset();
  for (struct cmsghdr* c = CMSG_FIRSTHDR(&r); c; c = CMSG_NXTHDR(&r, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
    size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (size_t i = 0; i < count; ++i) {
      int fd;
      std::memcpy(&fd, CMSG_DATA(c) + i * sizeof(int), sizeof fd);
      struct stat st;
      if (!*replyMemory && ::fstat(fd, &st) == 0) {
        std::vector<uint8_t> bytes(static_cast<size_t>(st.st_size));
        if (bytes.empty() ||
            ::pread(fd, bytes.data(), bytes.size(), 0) == static_cast<ssize_t>(bytes.size()))
          *replyMemory = std::move(bytes);
      }
      ::close(fd);
    }
  }
  return true;
}
