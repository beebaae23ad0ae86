#include "platform/VSAIPCConnection.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>

#include "platform/VSAFrameCodec.h"

VSAIPCConnection::VSAIPCConnection(int fd, uint64_t identifier, VSAAuditToken auditToken)
    : fd_(fd), identifier_(identifier), auditToken_(auditToken) {
  struct timeval tv = {5, 0};
  setsockopt(fd_, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof tv);
}

VSAIPCConnection::~VSAIPCConnection() { ::close(fd_); }

bool VSAIPCConnection::send(const VSAValue& message, VSAErrorRef* error) {
  auto frame = VSAFrameCodec::encode(message, error);
  if (!frame) return false;
  std::lock_guard lock(sendMutex_);
  size_t done = 0;
  while (done < frame->size()) {
    ssize_t n = ::send(fd_, frame->data() + done, frame->size() - done, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      int err = n < 0 ? errno : EPIPE;
      VSASetError(error, VSA_POSIX_ERROR(err));
      cancel();  // the stream is broken mid-frame: nothing more can follow on it
      return false;
    }
    done += static_cast<size_t>(n);
  }
  return true;
}

void VSAIPCConnection::cancel() {
  if (!cancelled_.exchange(true)) ::shutdown(fd_, SHUT_RDWR);
}

std::string VSAIPCConnection::description() const {
  return VSAFormat("<connection %llu %@>", identifier_, auditToken_);
}
