// The client registry: who a peer process is and what it may do.
//
// Each root-owned file `<root>/etc/vessad/clients.d/*.plist` describes one
// executable: "Executable" (its path on the device, resolved below the system
// root), "SigningIdentifier", "Entitlements" (dictionary), "Sandboxed" and
// "KernelBridge" (booleans). A peer is matched on the real path of its
// /proc/<pid>/exe, and only while its audit token still names the same
// process. A file that is not owned by root, is writable by others, or is
// malformed is skipped with a log line: such an entry gives no identity
// rather than a wrong one. The directory is re-read when it changes.
// Thread-safe.
#pragma once

#include <ctime>
#include <map>
#include <mutex>
#include <optional>
#include <string>

#include "base/VSAValue.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSASystemRoot.h"

struct VSAClientRegistryEntry {
  std::string executable;  // host path of the executable, canonical
  std::string signingIdentifier;
  VSAValue entitlements = VSAValue::dictionary();
  bool sandboxed = false;
  bool kernelBridge = false;
};

class VSAClientRegistry {
 public:
  explicit VSAClientRegistry(VSASystemRoot root);

  std::string directory() const { return root_.resolve("/etc/vessad/clients.d"); }
  // The entry of the process named by `token`, if it is registered.
  std::optional<VSAClientRegistryEntry> entryForAuditToken(const VSAAuditToken& token);
  // The entry registered for a host executable path.
  std::optional<VSAClientRegistryEntry> entryForExecutable(const std::string& hostPath);

 private:
  void reloadIfChanged();
  std::optional<VSAClientRegistryEntry> loadEntry(const std::string& file);

  VSASystemRoot root_;
  std::mutex mutex_;
  struct timespec loadedMTime_ = {-1, 0};
  std::map<std::string, VSAClientRegistryEntry> byExecutable_;
};
