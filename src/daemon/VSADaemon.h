// The daemon process: entry, initialisation and orderly shutdown.
//
// run() is the process entry: it creates the serial listener queue, queues
// the initialisation routine on it, creates and resumes the IPC listener on
// the same queue (so no request is served before initialisation returns) and
// parks the calling thread in the main loop. Initialisation ("vessad_init")
// opens the rotating log, creates the work queues, runs first-boot setup
// (only when the first-boot semaphore is absent) and boot setup, subscribes
// to lock-state changes and starts the two cleanups. requestStop() (from the
// signal thread) stops accepting requests, waits for open transactions and
// returns from run(). requestStateDump() (SIGUSR1) writes the daemon's state
// to the log and to the run directory's "state.json"; the run directory
// also holds "vessad.pid" while the daemon runs, for whoever sends the signal.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "daemon/VSAClientConnection.h"
#include "daemon/VSADaemonContext.h"
#include "daemon/VSAKernelUpcall.h"
#include "daemon/VSALockStateMonitor.h"
#include "daemon/VSARelayDispatcher.h"
#include "platform/VSAIPCListener.h"

inline constexpr const char* kVSAFirstBootSemaphore = "vessad.fb_check";

class VSADaemon {
 public:
  struct Options {
    std::string root = "/";
    int logLevel = 5;
    bool afterBoot = false;  // forget the first-boot marker: this start follows a boot
    // Under socket activation: leave after this many seconds with no client,
    // transaction or background work (0: never).
    int idleExitSeconds = 0;
  };

  explicit VSADaemon(Options options);
  ~VSADaemon();

  int run();
  // Stops accepting requests, waits for open transactions, then makes run()
  // return. Blocks; call it from any thread but the main one.
  void requestStop();
  // Queues a state dump; returns at once. Any thread.
  void requestStateDump();
  VSADaemonContext& context() { return *context_; }
  // The idle period, 0 when the daemon does not leave when idle (not asked
  // for, or its sockets are its own: nothing would start it again).
  int idleExitSeconds() const { return idleExitSeconds_; }
  // Called once an idle period (by the signal thread): when nothing has
  // happened for a whole period and nothing is under way, holds both
  // sockets, looks once more, and stops the daemon (run() returns 0);
  // answers whether it did. Connections that arrive from then on wait in
  // the sockets' backlogs, which the service manager keeps, for the next start.
  bool exitIfIdle();

 private:
  void initialize();
  void openLogs();
  bool isFirstBoot();
  void startCleanups(bool firstBoot);
  void drainForShutdown();
  VSAIPCListener::Route routeRequest(const VSAValue& body);
  void writePidFile();
  // Nothing under way; `activity` receives a count that moves with any work.
  bool isIdle(uint64_t* activity);
  void holdAccepting(bool hold);
  void checkIdleExitIsPossible();

  Options options_;
  std::unique_ptr<VSADaemonContext> context_;
  std::unique_ptr<VSARelayDispatcher> dispatcher_;
  std::unique_ptr<VSAIPCListener> listener_;
  // Serves command 31 off the listener queue; resumed once start-up is over.
  VSAWorkQueue::Ref testLockQueue_;
  std::unique_ptr<VSAClientConnection> sharedConnection_;
  std::unique_ptr<VSALockStateMonitor> lockStateMonitor_;
  std::unique_ptr<VSAKernelUpcall> upcall_;
  // The upcall socket, bound with the request socket before initialisation
  // and handed to upcall_ when initialisation starts serving it.
  std::unique_ptr<VSAUpcallListener> upcallListener_;
  std::string firstBootSemaphore_;
  std::atomic<bool> stopping_{false};
  // A test-lock command has been received: requests may freeze at test locks
  // from now on, so none runs on the listener's I/O thread, which must stay
  // free to read the command that thaws them.
  std::atomic<bool> testLocksInUse_{false};
  std::atomic<bool> cleanupsDone_{false};  // the every-start cleanup has finished
  std::atomic<bool> initialized_{false};   // the subsystems are set; a dump may read them
  VSAWorkQueue::Ref stateQueue_;           // runs state dumps, one at a time
  std::atomic<uint64_t> dumpGeneration_{0};
  std::atomic<int> idleExitSeconds_{0};
  bool wasIdle_ = false;  // at the previous idle check (signal thread only)
  uint64_t lastActivity_ = 0;
  // Guards listener_: a signal may ask for a stop while run() sets it up.
  std::mutex listenerMutex_;
};
