// One peer connection of the IPC message service.
//
// Created by the listener for each accepted socket; shared by the listener's
// I/O thread and by every message received on it. send() is thread-safe and
// blocks for at most the send time-out (a peer that stops reading is cut off
// rather than stalling the daemon). cancel() shuts the socket down; the
// listener then forgets the connection and the descriptor closes with the
// last reference.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "platform/VSAAuditToken.h"

class VSAIPCConnection {
 public:
  VSAIPCConnection(int fd, uint64_t identifier, VSAAuditToken auditToken);
  ~VSAIPCConnection();
  VSAIPCConnection(const VSAIPCConnection&) = delete;
  VSAIPCConnection& operator=(const VSAIPCConnection&) = delete;

  bool send(const VSAValue& message, VSAErrorRef* error);
  void cancel();
  bool isCancelled() const { return cancelled_.load(); }

  int fd() const { return fd_; }
  uint64_t identifier() const { return identifier_; }
  const VSAAuditToken& auditToken() const { return auditToken_; }
  std::string description() const;

 private:
  int fd_;
  uint64_t identifier_;
  VSAAuditToken auditToken_;
  std::mutex sendMutex_;
  std::atomic<bool> cancelled_{false};
};

using VSAIPCConnectionRef = std::shared_ptr<VSAIPCConnection>;
