#include "platform/VSAUpcallClient.h"

#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/VSADescriptorPassing.h"

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
  int memfd = memory ? VSAMemfdWithBytes("vessa-upcall-request", *memory, false) : -1;
  if (memory && memfd < 0) return fail(why, "memfd");
  ssize_t sent = VSASendWithDescriptor(fd_, message, memfd, 0);
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
  for (int fd : VSAReceivedDescriptors(r)) {
    struct stat st;
    if (!*replyMemory && ::fstat(fd, &st) == 0) {
      std::vector<uint8_t> bytes(static_cast<size_t>(st.st_size));
      if (bytes.empty() ||
          ::pread(fd, bytes.data(), bytes.size(), 0) == static_cast<ssize_t>(bytes.size()))
        *replyMemory = std::move(bytes);
    }
    ::close(fd);
  }
  return true;
}
