// The kernel upcall service of one daemon: the seqpacket listener, the
// serial queue "com.tamsk.vessad.upcall" (targeted at the listener queue,
// so upcalls and client requests never overlap) and the server, whose
// containers are made by a privileged client connection marked as the
// kernel and granted other-identifier, group and unrestricted lookups.
// The listener's I/O thread serves an upcall itself while both queues are
// idle, and hands it to the upcall queue otherwise.
// Started once by the daemon's initialisation; stopped with the daemon.
#pragma once

#include <memory>

#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"
#include "daemon/VSADaemonContext.h"
#include "platform/VSAUpcallListener.h"
#include "upcall/VSAUpcallServer.h"

class VSAKernelUpcall {
 public:
  VSAKernelUpcall(VSADaemonContext& context, VSAWorkQueue::Ref targetQueue);
  ~VSAKernelUpcall();
  // Starts serving on `bound` (a listener whose socket was bound before
  // initialisation, so that upcalls wait in its backlog meanwhile), or binds
  // one now; false (logged) when it cannot.
  bool start(std::unique_ptr<VSAUpcallListener> bound = nullptr);
  // A listener for this daemon's upcall socket, not yet serving.
  static std::unique_ptr<VSAUpcallListener> listenerFor(VSADaemonContext& context);
  void stop();
  // The listener serving the socket; null before start() and after stop().
  VSAUpcallListener* listener() const { return listener_.get(); }

  // The environment the server works in, over `context` (tests use it directly).
  static VSAUpcallEnvironment environmentFor(VSADaemonContext& context);

 private:
  void serve(VSAUpcallPacket packet, const VSAUpcallListener::Reply& reply);

  VSADaemonContext& context_;
  VSAWorkQueue::Ref queue_;
  VSAUpcallServer server_;
  std::unique_ptr<VSAUpcallListener> listener_;
};
