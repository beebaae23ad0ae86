// One peer connection of the IPC message service.
//
// Created by the listener for each accepted socket; shared by the listener's
// I/O thread and by every message received on it. send() is thread-safe and
// blocks for at most the send time-out (a peer that stops reading is cut off
// rather than stalling the daemon). cancel() shuts the socket down; the
// listener then forgets the connection and the descriptor closes with the
// last reference.
//
// Identity: the constructor pins the peer's executable (device and inode of
// /proc/<pid>/exe) and, given a client registry, resolves the peer's registry
// entry once, there and then. A process can connect and then execve another
// program (or hand the socket to a process that does), and pid and start time
// survive that; so before serving each request the dispatcher asks
// peerIsUnchanged(), and a connection whose peer now runs another file is
// dropped rather than served.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAPeerExecutable.h"

class VSAIPCConnection {
 public:
  // `registry` may be null: the peer then has no registry entry.
  VSAIPCConnection(int fd, uint64_t identifier, VSAAuditToken auditToken,
                   VSAClientRegistry* registry = nullptr);
  ~VSAIPCConnection();
  VSAIPCConnection(const VSAIPCConnection&) = delete;
  VSAIPCConnection& operator=(const VSAIPCConnection&) = delete;

  bool send(const VSAValue& message, VSAErrorRef* error);
  void cancel();
  bool isCancelled() const { return cancelled_.load(); }

  int fd() const { return fd_; }
  uint64_t identifier() const { return identifier_; }
  const VSAAuditToken& auditToken() const { return auditToken_; }
  // The executable pinned at accept; nothing when it could not be examined.
  const std::optional<VSAPeerExecutable>& executable() const { return executable_; }
  // The registry entry resolved at accept; nothing for an unregistered peer.
  const std::optional<VSAClientRegistryEntry>& registryEntry() const { return registryEntry_; }
  // The peer process is alive and still runs the executable pinned at accept.
  bool peerIsUnchanged() const;
  std::string description() const;

 private:
  int fd_;
  uint64_t identifier_;
  VSAAuditToken auditToken_;
  std::optional<VSAPeerExecutable> executable_;
  std::optional<VSAClientRegistryEntry> registryEntry_;
  std::mutex sendMutex_;
  std::atomic<bool> cancelled_{false};
};

using VSAIPCConnectionRef = std::shared_ptr<VSAIPCConnection>;
