#include "platform/VSAIPCClient.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/VSAIPCMessage.h"

VSAIPCClient::~VSAIPCClient() { close(); }

bool VSAIPCClient::connect(const std::string& socketPath, VSAErrorRef* error) {
  close();
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (socketPath.size() >= sizeof addr.sun_path) {
    VSASetError(error, VSA_POSIX_ERROR(ENAMETOOLONG));
    return false;
  }
  std::memcpy(addr.sun_path, socketPath.c_str(), socketPath.size() + 1);
  fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd_ < 0 || ::connect(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    int err = errno;
    close();
    VSASetError(
        error, VSA_POSIX_ERROR(err, "cannot connect to " + socketPath + ": " + std::strerror(err)));
    return false;
  }
  return true;
}

void VSAIPCClient::close() {
  if (fd_ >= 0) ::close(fd_);
  fd_ = -1;
  reader_ = VSAFrameReader();
  early_.clear();
}

bool VSAIPCClient::sendRaw(const void* bytes, size_t length, VSAErrorRef* error) {
  const uint8_t* p = static_cast<const uint8_t*>(bytes);
  size_t done = 0;
  while (done < length) {
    ssize_t n = ::send(fd_, p + done, length - done, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      VSASetError(error, VSA_POSIX_ERROR(n < 0 ? errno : EPIPE));
      return false;
    }
    done += static_cast<size_t>(n);
  }
  return true;
}

std::optional<uint64_t> VSAIPCClient::send(VSAValue request, VSAErrorRef* error) {
  uint64_t id;
  if (auto existing = request.get(kVSAMessageIDKey); existing && existing->uint64Value()) {
    id = *existing->uint64Value();
  } else {
    id = nextID_++;
    request.set(kVSAMessageIDKey, VSAValue(id));
  }
  auto frame = VSAFrameCodec::encode(request, error);
  if (!frame || !sendRaw(frame->data(), frame->size(), error)) return std::nullopt;
  return id;
}

bool VSAIPCClient::readSome(std::chrono::milliseconds timeout, VSAErrorRef* error) {
  pollfd pfd{fd_, POLLIN, 0};
  int r;
  do {
    r = poll(&pfd, 1, static_cast<int>(timeout.count()));
  } while (r < 0 && errno == EINTR);
  if (r == 0) {
    VSASetError(error, VSA_POSIX_ERROR(ETIMEDOUT, "timed out waiting for a reply"));
    return false;
  }
  uint8_t buf[65536];
  ssize_t n;
  do {
    n = recv(fd_, buf, sizeof buf, 0);
  } while (n < 0 && errno == EINTR);
  if (n <= 0) {
    VSASetError(error, VSA_POSIX_ERROR(n < 0 ? errno : ECONNRESET, "connection closed by vessad"));
    return false;
  }
  reader_.append(buf, static_cast<size_t>(n));
  return true;
}

std::optional<VSAValue> VSAIPCClient::waitForReply(uint64_t messageID,
                                                   std::chrono::milliseconds timeout,
                                                   VSAErrorRef* error) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    if (auto it = early_.find(messageID); it != early_.end()) {
      VSAValue reply = std::move(it->second);
      early_.erase(it);
      return reply;
    }
    std::vector<uint8_t> payload;
    auto status = reader_.next(payload);
    if (status == VSAFrameReader::Status::Oversized) {
      VSASetError(error, VSA_POSIX_ERROR(EMSGSIZE, "oversized reply"));
      return std::nullopt;
    }
    if (status == VSAFrameReader::Status::Frame) {
      std::string why;
      auto reply = VSAFrameCodec::decodePayload(payload.data(), payload.size(), &why);
      if (!reply || !reply->isDictionary()) {
        VSASetError(error, VSA_POSIX_ERROR(EBADMSG, "undecodable reply: " + why));
        return std::nullopt;
      }
      const VSAValue* id = reply->get(kVSAMessageIDKey);
      uint64_t got = id && id->uint64Value() ? *id->uint64Value() : 0;
      if (got == messageID) return reply;
      early_[got] = std::move(*reply);
      continue;
    }
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) left = std::chrono::milliseconds(0);
    if (!readSome(left, error)) return std::nullopt;
  }
}

std::optional<VSAValue> VSAIPCClient::sendRequest(VSAValue request,
                                                  std::chrono::milliseconds timeout,
                                                  VSAErrorRef* error) {
  auto id = send(std::move(request), error);
  if (!id) return std::nullopt;
  return waitForReply(*id, timeout, error);
}

bool VSAIPCClient::waitForClose(std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return false;
    pollfd pfd{fd_, POLLIN, 0};
    if (poll(&pfd, 1, static_cast<int>(left.count())) <= 0) continue;
    uint8_t buf[4096];
    ssize_t n = recv(fd_, buf, sizeof buf, 0);
    if (n <= 0) return true;
  }
}
