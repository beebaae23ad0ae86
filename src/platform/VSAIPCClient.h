// Client side of the IPC message service, used by vessactl, the load
// generator and the end-to-end tests.
//
// sendRequest() stamps a fresh "MessageID" on the request (unless it has one)
// and waits for the reply carrying the same id; replies to other requests
// that arrive meanwhile are kept and handed to their own waiters, so several
// requests may be outstanding at once. Not thread-safe: one thread per client.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "platform/VSAFrameCodec.h"

class VSAIPCClient {
 public:
  VSAIPCClient() = default;
  ~VSAIPCClient();
  VSAIPCClient(const VSAIPCClient&) = delete;
  VSAIPCClient& operator=(const VSAIPCClient&) = delete;

  bool connect(const std::string& socketPath, VSAErrorRef* error);
  void close();
  bool isConnected() const { return fd_ >= 0; }

  // Sends without waiting; returns the MessageID used.
  std::optional<uint64_t> send(VSAValue request, VSAErrorRef* error);
  // Waits for the reply to `messageID`.
  std::optional<VSAValue> waitForReply(uint64_t messageID, std::chrono::milliseconds timeout,
                                       VSAErrorRef* error);
  std::optional<VSAValue> sendRequest(VSAValue request, std::chrono::milliseconds timeout,
                                      VSAErrorRef* error);
  // Writes raw bytes (tests of malformed input).
  bool sendRaw(const void* bytes, size_t length, VSAErrorRef* error);
  // True when the server closed the connection within `timeout`.
  bool waitForClose(std::chrono::milliseconds timeout);

 private:
  bool readSome(std::chrono::milliseconds timeout, VSAErrorRef* error);

  int fd_ = -1;
  uint64_t nextID_ = 1;
  VSAFrameReader reader_;
  std::map<uint64_t, VSAValue> early_;
};
