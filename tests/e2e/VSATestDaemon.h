// A real vessad on a temporary system root, for end-to-end tests.
//
// Builds the root (client registry, run directory), starts the daemon binary
// with --root, talks to it through the real socket and the real client, and
// stops it with SIGTERM. Clients are registered by placing an executable in
// the root (a symlink to this test binary, or a copy of vessactl so that
// several distinct clients exist) and a registry entry naming it.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "base/VSAValue.h"

// Makes the daemon's log file a FIFO, so that initialisation (whose first
// step opens the log) blocks until release() starts draining it.
class VSAInitialisationHold {
 public:
  explicit VSAInitialisationHold(const std::string& root);
  ~VSAInitialisationHold();
  void release();

 private:
  std::string fifo_;
  std::atomic<bool> stop_{false};
  std::thread reader_;
};

// The result code of a reply (0 when there is no reply or no code).
inline uint64_t VSAReplyError(const std::optional<VSAValue>& reply) {
  const VSAValue* v = reply ? reply->get("ReplyError") : nullptr;
  return v ? v->uint64Value().value_or(0) : 0;
}
// A string reply key ("" when absent or not a string).
inline std::string VSAReplyString(const std::optional<VSAValue>& reply, const char* key) {
  const VSAValue* v = reply ? reply->get(key) : nullptr;
  return v && v->isString() ? *v->stringValue() : std::string();
}

class VSATestDaemon {
 public:
  VSATestDaemon();
  ~VSATestDaemon();

  const std::string& root() const { return root_; }
  std::string path(const std::string& devicePath) const { return root_ + devicePath; }

  // Registers this test process under `signingIdentifier`.
  void registerSelf(const std::string& signingIdentifier, const VSAValue& entitlements,
                    bool sandboxed = false);
  // Registers this test process as the kernel's side of the upcall.
  void registerSelfAsKernelBridge();
  // Installs vessa-upcall as /usr/bin/vessa-upcall, registered as the kernel
  // bridge; run it with vessactl("vessa-upcall", args).
  void registerUpcallTool();
  // Installs vessa-launch as /usr/bin/vessa-launch, registered as the kernel
  // bridge that may look up other identifiers' bundles, as provisioning does;
  // run it with vessactl("vessa-launch", args).
  void registerLaunchTool();
  std::string upcallSocketPath() const { return root_ + "/run/vessad/com.tamsk.vessad.upcall"; }
  // Registers a copy of vessactl installed as /usr/bin/<name>.
  void registerVessactl(const std::string& name, const std::string& signingIdentifier,
                        const VSAValue& entitlements);

  // Writes the device's persona list: the personal persona 1000
  // ("PERSONAL-1000") and the enterprise persona 1001 ("WORK-1001", laid out
  // in /private/var/enterprise/1001) that lists `enterpriseApp`.
  void writePersonas(const std::string& enterpriseApp) const;

  // Runs vessad through `prefix` (for example a program that starts it in a
  // namespace of its own) from the next start on.
  void setLaunchPrefix(std::vector<std::string> prefix) { prefix_ = std::move(prefix); }
  // Hands the next start `fds` (listening sockets) as socket activation does:
  // the daemon takes over sockets that may already hold connections.
  void setActivationSockets(std::vector<int> fds) { activationFds_ = std::move(fds); }
  // Starts vessad; waits for its socket unless told not to.
  bool start(bool waitForSocket = true, std::vector<std::string> extraArgs = {});
  // SIGTERM and wait; returns the exit status (or -1 on a signal/time-out).
  int stop(std::chrono::seconds timeout = std::chrono::seconds(20));
  // SIGKILL and wait: the daemon dies wherever it is, as in a crash.
  void crash();
  // Waits for the daemon to end by itself; true with its wait status.
  bool waitForExit(std::chrono::seconds timeout, int* status);
  bool running() const { return pid_ > 0; }
  std::string socketPath() const { return root_ + "/run/vessad/com.tamsk.vessad"; }

  // Sends one request from this process and returns the reply.
  std::optional<VSAValue> request(VSAValue body,
                                  std::chrono::milliseconds timeout = std::chrono::seconds(10));
  struct Run {
    int status;
    std::string output;
  };
  // Runs vessactl (`client` = a registered copy's name, or "" for the
  // unregistered build output) with --root and the given arguments.
  Run vessactl(const std::string& client, std::vector<std::string> args);
  // The root checker (`vessad --verify`) on this root, as an integrator runs it.
  Run verify(bool json = false) const;

  std::vector<std::string> notifications() const;
  // Waits until the notification log holds `count` names.
  bool waitForNotifications(size_t count, std::chrono::seconds timeout = std::chrono::seconds(10));
  std::string daemonOutput() const;
  std::string firstBootSemaphore() const;

 private:
  static Run run(std::vector<std::string> argv);

  std::string root_;
  pid_t pid_ = -1;
  std::vector<std::string> prefix_;
  std::vector<int> activationFds_;
};

// Runs `body` in a child process of the mobile user (uid and gid 501, no
// other groups), as an app would act: the child's exit status (`body`'s
// result) and what it wrote to its standard output.
VSATestDaemon::Run VSARunAsMobileUser(const std::function<int()>& body);
