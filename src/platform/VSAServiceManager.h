// The service manager that started the daemon (systemd with Type=notify),
// told how start-up and shutdown go: "READY=1" once initialisation has
// finished (requests are served from then on), "STATUS=..." lines while the
// boot work runs, "STOPPING=1" when a stop begins. Nothing is sent when no
// manager listens (NOTIFY_SOCKET unset), so the calls cost nothing then.
// Stateless; thread-safe.
#pragma once

#include <string>

class VSAServiceManager {
 public:
  static void notifyReady(const std::string& status);
  static void notifyStatus(const std::string& status);
  static void notifyStopping();
};
