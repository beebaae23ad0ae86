#include "platform/VSAIPCConnection.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>

#include "platform/VSAFrameCodec.h"

VSAIPCConnection::VSAIPCConnection(int fd, uint64_t identifier, VSAAuditToken auditToken,
                                   VSAClientRegistry* registry)
    : fd_(fd),
      identifier_(identifier),
      auditToken_(auditToken),
      executable_(VSAPeerExecutable::ofProcess(auditToken)) {
  struct timeval tv = {5, 0};
  setsockopt(fd_, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof tv);
  // The entry is looked up once, for the file the peer ran when it connected.
  if (registry && executable_ && !executable_->path.empty())
    registryEntry_ = registry->entryForPeer(auditToken_, executable_->path);
}

VSAIPCConnection::~VSAIPCConnection() { ::close(fd_); }

bool VSAIPCConnection::peerIsUnchanged() const {
  return executable_ && executable_->isRunBy(auditToken_);
}

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
