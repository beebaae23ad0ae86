// The IPC service listener: a Unix stream socket at the root's service path.
//
// listen() binds the socket (or adopts one passed by systemd socket
// activation). Nothing is accepted until resume(): then an I/O thread accepts
// peers, reassembles frames and submits each message, in arrival order, to
// the listener's serial work queue, where the handler runs. Bad input is
// contained per connection: an oversized length or a stream that ends inside
// a frame drops that connection (and is logged); a frame that does not decode
// is delivered as a message without reply context. stop() closes the socket
// and every connection and joins the thread.
#pragma once

#include <atomic>
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

class VSAIPCListener {
 public:
  using Handler = std::function<void(const VSAIPCMessageRef&)>;

  // `registry` (may be null) gives each accepted peer its registry entry.
  VSAIPCListener(std::string socketPath, VSAWorkQueue::Ref queue,
                 std::shared_ptr<VSATransactions> transactions,
                 std::shared_ptr<VSAClientRegistry> registry = nullptr);
  ~VSAIPCListener();
  VSAIPCListener(const VSAIPCListener&) = delete;
  VSAIPCListener& operator=(const VSAIPCListener&) = delete;

  bool listen(VSAErrorRef* error);
  void setHandler(Handler handler);
  void resume();
  // Stops accepting and reading; open connections stay up for late replies.
  void stopAccepting();
  // stopAccepting() and closes every connection.
  void stop();
  size_t connectionCount() const;

 private:
  struct Peer;
  void run();
  void acceptPeers();
  void readPeer(int fd);
  void dropPeer(int fd, const char* why);
  void deliver(const VSAIPCConnectionRef& connection, std::optional<VSAValue> body,
               std::string problem);

  std::string socketPath_;
  VSAWorkQueue::Ref queue_;
  std::shared_ptr<VSATransactions> transactions_;
  std::shared_ptr<VSAClientRegistry> registry_;
  std::mutex handlerMutex_;
  Handler handler_;
  int listenFd_ = -1;
  int epollFd_ = -1;
  int stopFd_ = -1;
  bool ownsSocketFile_ = false;
  std::thread thread_;
  mutable std::mutex peersMutex_;
  std::map<int, std::unique_ptr<Peer>> peers_;
  uint64_t nextIdentifier_ = 1;
};
