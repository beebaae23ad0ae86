// The IPC service listener: a Unix stream socket at the root's service path.
//
// listen() binds the socket (or adopts one passed by systemd socket
// activation). Nothing is accepted until resume(): then an I/O thread accepts
// peers, reassembles frames and submits each message, in arrival order, to
// the listener's serial work queue, where the handler runs (or, for a route
// that allows it, runs the handler itself while that queue is idle). The same thread
// writes out replies that a peer's socket did not take at once (see
// VSAIPCConnection), so the handler never waits for a slow reader.
//
// Bad input is contained per connection: an oversized length or a stream that
// ends inside a frame drops that connection (and is logged); a frame that does
// not decode, or whose "MessageID" is neither an integer nor a string of at
// most kVSAMaxMessageIDLength bytes, is delivered as a message without reply
// context. Resources are bounded by VSAIPCListenerLimits:
//  - connections per process (pid and start time: every app shares the
//    mobile user's uid, so a bound per uid would let one app shut out the
//    rest); the excess of one process is accepted and closed;
//  - connections of all processes together: at that bound the idle
//    connections of the process holding the most are closed to make room
//    (a newcomer is refused only when none is idle). Before either bound
//    refuses anyone, connections whose peers have already hung up are
//    dropped, so a closed connection never counts;
//  - when the process is out of descriptors, a reserve descriptor is given up
//    for a moment to accept and close the waiting peer, so the accept loop
//    neither spins nor starves those already connected;
//  - a connection with no request in flight and no complete frame for
//    `idleTimeout`, or whose current frame is not complete `frameTimeout`
//    after its first byte, is dropped;
//  - the bytes of incomplete frames held for all connections together stay
//    within `maxBufferedInput`: the connection whose input would exceed it
//    is dropped;
//  - replies waiting for one peer stay within `maxPendingOutput`;
//  - a peer with `maxRequestsInFlight` requests received and not yet finished
//    is not read until half of them are done, so the listener queue never
//    holds an unbounded number of one client's requests.
// Refusals are logged at most once per second with a count.
//
// stopAccepting() closes the listening socket and stops reading requests;
// the I/O thread keeps writing late replies until stop(), which closes every
// connection and joins the thread.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAIPCMessage.h"
#include "platform/VSATransactions.h"

inline constexpr size_t kVSAMaxMessageIDLength = 64;

struct VSAIPCListenerLimits {
  size_t maxConnectionsPerProcess = 64;
  size_t maxConnections = 1024;                           // all processes together
  size_t maxPendingOutput = kVSADefaultMaxPendingOutput;  // per connection
  size_t maxBufferedInput = 64u << 20;                    // all connections together
  size_t maxRequestsInFlight = 256;                       // per connection
  std::chrono::milliseconds idleTimeout = std::chrono::minutes(10);
  std::chrono::milliseconds frameTimeout = std::chrono::seconds(10);
};

class VSAIPCListener {
 public:
  using Handler = std::function<void(const VSAIPCMessageRef&)>;
  // Where a request is handled. `queue` null keeps the listener's queue.
  // With `runInline`, the I/O thread runs the handler itself when the queue
  // is idle and no other peer is waiting to be read (VSAWorkQueue::runIfIdle),
  // saving the hand-off to a pool thread and back: the order of requests is
  // the same, but the I/O thread reads,
  // accepts and flushes nothing while such a handler runs, so it is only for
  // handlers that never wait for another request to arrive.
  struct Route {
    VSAWorkQueue::Ref queue;
    bool runInline = false;
  };
  // Without a router every request goes to the listener's queue, never inline.
  using Router = std::function<Route(const VSAValue& body)>;

  // `registry` (may be null) gives each accepted peer its registry entry.
  VSAIPCListener(std::string socketPath, VSAWorkQueue::Ref queue,
                 std::shared_ptr<VSATransactions> transactions,
                 std::shared_ptr<VSAClientRegistry> registry = nullptr,
                 VSAIPCListenerLimits limits = VSAIPCListenerLimits());
  ~VSAIPCListener();
  VSAIPCListener(const VSAIPCListener&) = delete;
  VSAIPCListener& operator=(const VSAIPCListener&) = delete;

  bool listen(VSAErrorRef* error);
  void setHandler(Handler handler);
  // Requests the router sends elsewhere leave the listener's serial order:
  // they may overtake requests of the same peer still waiting in its queue.
  void setRouter(Router router);
  void resume();
  // Stops accepting and reading; open connections stay up for late replies.
  void stopAccepting();
  // stopAccepting() and closes every connection.
  void stop();
  size_t connectionCount() const;
  // Holds new connections back (they wait in the socket's backlog) or lets
  // them in again. Returns once the I/O thread has done it: every connection
  // accepted before a hold is then counted by connectionCount().
  void holdAccepting(bool hold);
  // The socket came from a service manager, which keeps it when the daemon ends.
  bool socketIsInherited() const { return inherited_; }
  // A "MessageID" a reply can carry back: an integer or a short string.
  static bool isValidMessageID(const VSAValue& id);

 private:
  struct Peer;
  struct Resumer;
  using Clock = std::chrono::steady_clock;
  // A process: its pid and start time, so a reused pid is another process.
  using ProcessKey = std::pair<pid_t, uint64_t>;
  void run();
  void acceptPeers();
  // Accepts and closes one waiting peer using the reserve descriptor.
  bool shedOnePeer();
  void readPeer(int fd);
  // Delivers the complete frames read so far (pausing the peer when it has
  // too many requests in flight); false when the peer was dropped.
  bool processFrames(int fd, Peer& peer);
  // Resumes the paused peers whose requests have drained.
  void resumePeers();
  void writePeer(int fd);
  void dropPeer(int fd, const char* why);
  // Whether a connection of `process` may be added, making room if it can.
  bool admit(const ProcessKey& process);
  // Drops the connections (of `process`, or of all) whose peers hung up.
  void dropHungUpPeers(const ProcessKey* process);
  // Closes the idle connections of the process holding the most; false
  // when there was none to close.
  bool shedLargestHolder();
  void sweep(Clock::time_point now);
  void noteRefusal(const char* why);
  void deliver(const VSAIPCConnectionRef& connection, std::optional<VSAValue> body,
               std::string problem);
  // Closes the listening socket and stops reading requests; on the I/O thread
  // once it runs.
  void _onThread_stopAccepting();
  void _onThread_holdAccepting(bool hold);

  std::string socketPath_;
  VSAWorkQueue::Ref queue_;
  std::shared_ptr<VSATransactions> transactions_;
  std::shared_ptr<VSAClientRegistry> registry_;
  VSAIPCListenerLimits limits_;
  std::shared_ptr<Resumer> resumer_;
  std::mutex handlerMutex_;
  Handler handler_;
  Router router_;
  int listenFd_ = -1;
  int epollFd_ = -1;
  int stopFd_ = -1;
  int reserveFd_ = -1;
  bool ownsSocketFile_ = false;
  std::atomic<bool> accepting_{false};
  std::thread thread_;
  // Hand-over between stopAccepting()/stop() and the I/O thread.
  std::mutex controlMutex_;
  std::condition_variable controlChanged_;
  bool stopAcceptingRequested_ = false;
  bool acceptingStopped_ = false;
  bool stopRequested_ = false;
  bool threadExited_ = false;
  bool holdRequested_ = false;
  bool held_ = false;
  mutable std::mutex peersMutex_;
  std::map<int, std::unique_ptr<Peer>> peers_;
  std::map<ProcessKey, size_t> connectionsPerProcess_;
  size_t bufferedInput_ = 0;    // I/O thread only
  bool inlineAllowed_ = false;  // I/O thread only: one peer is ready in this wake-up
  uint64_t nextIdentifier_ = 1;
  // Accepting pauses briefly when even the reserve descriptor is gone.
  Clock::time_point acceptPausedUntil_{};
  bool acceptPaused_ = false;
  bool acceptHeld_ = false;  // I/O thread only: holdAccepting(true) is in force
  bool inherited_ = false;
  // Rate-limited refusal log (I/O thread only).
  Clock::time_point lastRefusalLog_{};
  size_t refusalsSinceLog_ = 0;
  const char* lastRefusal_ = "";
};
