// The kernel upcall's transport: a Unix SOCK_SEQPACKET socket
// (`<root>/run/vessad/com.tamsk.vessad.upcall`, mode 0600). Each packet is
// one request message; its out-of-line memory arrives as one memfd in
// SCM_RIGHTS. The reply is one packet, with the reply memory (a memfd the
// handler made) when there is any.
//
// An I/O thread accepts peers and receives packets. Each peer's identity is
// fixed when it connects (SO_PEERCRED and its start time); a peer whose
// client-registry entry says "KernelBridge" is the kernel, and its audit
// token carries pid 0. The memfd is read into memory (at most
// `maxMemorySize` bytes; a larger one is reported by size only) and closed;
// extra descriptors make the packet malformed. The handler gets each packet
// on the I/O thread and answers later, from any thread, through the reply
// function it is given. A reply the socket does not take at once waits in
// the peer's queue and is written out by the I/O thread as room appears:
// none is dropped because the kernel's side was slow to read. Bounded: at
// most `kMaxPeers` connections, and a peer with `kMaxInFlight` unanswered
// packets is not read until answered. A peer reported with pid 0 (one outside
// the daemon's pid namespace) is refused, so that pid 0 means the bridge
// alone; a peer that is not the bridge gets the answer to its first packet
// (a refusal) and is disconnected. Without a registry no peer is the bridge,
// and none is disconnected for it (a bare transport).
#pragma once

#include <atomic>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "base/VSAError.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAUniqueFd.h"

struct VSAUpcallPacket {
  std::vector<uint8_t> message;        // the packet's bytes (longer than expected: truncated)
  std::optional<uint64_t> memorySize;  // the memfd's size, when one came
  std::vector<uint8_t> memory;         // its bytes, when not larger than the limit
  bool malformedDescriptors = false;   // several descriptors, or not a regular file
  std::array<uint8_t, 32> auditToken{};
  bool fromKernel = false;
};

class VSAUpcallListener {
 public:
  // Sends `message` with `memory` (a memfd, given over) attached when valid.
  using Reply = std::function<void(const std::vector<uint8_t>& message, VSAUniqueFd memory)>;
  using Handler = std::function<void(VSAUpcallPacket packet, Reply reply)>;
  static constexpr size_t kMaxPeers = 32;
  static constexpr int kMaxInFlight = 16;

  VSAUpcallListener(std::string socketPath, std::shared_ptr<VSAClientRegistry> registry,
                    uint64_t maxMemorySize);
  ~VSAUpcallListener();
  VSAUpcallListener(const VSAUpcallListener&) = delete;
  VSAUpcallListener& operator=(const VSAUpcallListener&) = delete;

  // Takes over the socket a service manager passed for the path, or binds
  // it (mode 0600). Connections wait in its backlog until start().
  bool bind(VSAErrorRef* error);
  // Binds the socket when bind() has not, and starts the I/O thread.
  bool start(Handler handler, VSAErrorRef* error);
  void stop();
  const std::string& socketPath() const { return path_; }
  // Holds new peers back (they wait in the socket's backlog) or lets them in
  // again; returns once the I/O thread has done it, so that every peer
  // accepted before a hold is counted by peerCount().
  void holdAccepting(bool hold);
  // Peers connected now, and peers ever accepted.
  size_t peerCount() const { return peerCount_; }
  uint64_t acceptedCount() const { return accepted_; }
  // The socket came from a service manager, which keeps it when the daemon ends.
  bool socketIsInherited() const { return listenFd_ >= 0 && !ownsSocketFile_; }

 private:
  struct Peer;
  struct Waker;
  void run();
  void acceptPeer();
  bool receive(const std::shared_ptr<Peer>& peer);

  std::string path_;
  std::shared_ptr<VSAClientRegistry> registry_;
  uint64_t maxMemorySize_;
  Handler handler_;
  int listenFd_ = -1;
  bool ownsSocketFile_ = false;  // not when a service manager passed it
  std::shared_ptr<Waker> waker_;
  std::atomic<bool> stopping_{false};
  std::thread thread_;
  std::vector<std::shared_ptr<Peer>> peers_;
  std::atomic<size_t> peerCount_{0};
  std::atomic<uint64_t> accepted_{0};
  std::mutex holdMutex_;
  std::condition_variable holdChanged_;
  bool holdRequested_ = false;
  bool held_ = false;  // the I/O thread's answer to holdRequested_
};
