// `vessactl status`: asks the daemon of a root for a state dump (SIGUSR1 to
// the pid in its run directory), waits for the new "state.json" and prints
// it, as a summary for people or as the JSON itself. A socket-activated
// daemon that is not running yet is started by a connection to its socket.
#pragma once

#include <string>

#include "base/VSAValue.h"

class VSACtlStatus {
 public:
  VSACtlStatus(std::string root, std::string socketPath, int timeoutSeconds)
      : root_(std::move(root)), socketPath_(std::move(socketPath)), timeout_(timeoutSeconds) {}
  // Exit status: 0 printed, 2 no daemon or no new state in time.
  int run(bool json);
  // The summary people read, from a state dump.
  static std::string summary(const VSAValue& state);

 private:
  int livePid();
  int waitForPid();
  bool readState(VSAValue* state, std::string* text);

  std::string root_, socketPath_;
  int timeout_;
};
