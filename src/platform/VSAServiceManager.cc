#include "platform/VSAServiceManager.h"

#include <systemd/sd-daemon.h>

void VSAServiceManager::notifyReady(const std::string& status) {
  sd_notify(0, ("READY=1\nSTATUS=" + status).c_str());
}

void VSAServiceManager::notifyStatus(const std::string& status) {
  sd_notify(0, ("STATUS=" + status).c_str());
}

void VSAServiceManager::notifyStopping() { sd_notify(0, "STOPPING=1\nSTATUS=Stopping"); }
