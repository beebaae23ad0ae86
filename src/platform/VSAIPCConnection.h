// One peer connection of the IPC message service.
//
// Created by the listener for each accepted socket; shared by the listener's
// I/O thread and by every message received on it.
//
// Identity: the constructor pins the peer's executable (device and inode of
// /proc/<pid>/exe) and, given a client registry, resolves the peer's registry
// entry once, there and then. A process can connect and then execve another
// program (or hand the socket to a process that does), and pid and start time
// survive that; so before serving each request the dispatcher asks
// peerIsUnchanged(), and a connection whose peer now runs another file is
// dropped rather than served.
//
// Output: send() never blocks. It writes what the socket takes at once and
// keeps the rest in a per-connection buffer that the listener's I/O thread
// drains when the socket becomes writable (attachToPoller() gives it the
// epoll instance; the connection asks for EPOLLOUT only while output is
// pending). A peer that stops reading cannot hold more than
// `maxPendingOutput` bytes: the send that would exceed it cancels the
// connection (logged). Without a poller, output the socket does not take at
// once stays pending.
//
// cancel() shuts the socket down; the listener then forgets the connection
// and the descriptor closes with the last reference. Thread-safe.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAPeerExecutable.h"
#include "platform/VSAPersonaService.h"
#include "platform/VSAUniqueFd.h"

// Bytes of replies a connection may have waiting for its peer to read them.
inline constexpr size_t kVSADefaultMaxPendingOutput = 8u << 20;  // 8 MiB

class VSAIPCConnection {
 public:
  // `registry` may be null: the peer then has no registry entry.
  VSAIPCConnection(int fd, uint64_t identifier, VSAAuditToken auditToken,
                   VSAClientRegistry* registry = nullptr,
                   size_t maxPendingOutput = kVSADefaultMaxPendingOutput);
  ~VSAIPCConnection();
  VSAIPCConnection(const VSAIPCConnection&) = delete;
  VSAIPCConnection& operator=(const VSAIPCConnection&) = delete;

  // Queues one frame; false (with `error`) when the connection is cancelled,
  // broken, or would exceed its output bound (it is then cancelled).
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
  // The peer's persona record, read by its first request (see VSACurrentPersonaScope).
  VSAPersonaRecordMemo* personaRecordMemo() const { return &personaRecord_; }
  std::string description() const;

  // --- For the listener's I/O thread. ---
  // Registers interest changes with `epollFd` from now on (the descriptor is
  // already in its set); -1 detaches.
  void attachToPoller(int epollFd);
  // Whether the poller should report input (false once the listener stops reading).
  void setReading(bool reading);
  // Input paused because the peer has too many requests in flight.
  void setThrottled(bool throttled);
  bool isThrottled() const { return throttled_.load(); }
  // Writes pending output; false when the connection broke (it is cancelled).
  bool flushPendingOutput();
  size_t pendingOutput() const;
  // Requests received and not yet finished (their message is still alive).
  void requestBegan();
  // Returns the number still in flight.
  size_t requestEnded();
  size_t requestsInFlight() const { return inFlight_.load(); }
  // When the last request finished (steady clock); the epoch before any.
  std::chrono::steady_clock::time_point lastRequestEnded() const;

 private:
  // Writes from the buffer until it is empty or the socket is full; caller holds outMutex_.
  bool _lock_writePending(int* err);
  void _lock_updateInterest();

  int fd_;
  uint64_t identifier_;
  VSAAuditToken auditToken_;
  std::optional<VSAPeerExecutable> executable_;
  // The peer process's /proc directory, opened at accept (-1 when it could not be).
  VSAUniqueFd processDirectory_;
  std::optional<VSAClientRegistryEntry> registryEntry_;
  mutable VSAPersonaRecordMemo personaRecord_;
  size_t maxPendingOutput_;

  mutable std::mutex outMutex_;
  std::vector<uint8_t> out_;
  size_t outSent_ = 0;  // bytes of out_ already written
  int epollFd_ = -1;
  bool reading_ = true;
  uint32_t interest_ = 0;

  std::atomic<bool> cancelled_{false};
  std::atomic<bool> throttled_{false};
  std::atomic<size_t> inFlight_{0};
  std::atomic<int64_t> lastRequestEnded_{0};
};

using VSAIPCConnectionRef = std::shared_ptr<VSAIPCConnection>;
