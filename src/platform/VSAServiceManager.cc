#include "platform/VSAServiceManager.h"

#include "base/VSASystemdLibrary.h"

namespace {
// Readiness and status for the service manager; nothing without libsystemd.
void notify(const std::string& state) {
  if (const auto* systemd = VSASystemdLibrary::get()) systemd->notify(0, state.c_str());
}
}  // namespace

void VSAServiceManager::notifyReady(const std::string& status) {
  notify("READY=1\nSTATUS=" + status);
}

void VSAServiceManager::notifyStatus(const std::string& status) { notify("STATUS=" + status); }

void VSAServiceManager::notifyStopping() { notify("STOPPING=1\nSTATUS=Stopping"); }
