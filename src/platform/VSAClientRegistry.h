// The client registry: who a peer process is and what it may do.
//
// Each root-owned file `<root>/etc/vessad/clients.d/*.plist` describes one
// executable: "Executable" (its path on the device, resolved below the system
// root), "SigningIdentifier", "Entitlements" (dictionary), "Sandboxed" and
// "KernelBridge" (booleans) and optionally "User" (the uid the client must run
// as: an integer, or a user name from the root's user database; root when
// none is named). A peer is matched on the real path of its /proc/<pid>/exe,
// only while its audit token still names the same process, and only when its
// uid is the entry's user. The uid is the one thing the kernel fixes when a
// peer connects; the program it runs can change by exec before the daemon
// looks. Tying each entry to one uid means no process can become a program
// registered for another uid that way. A file that is not owned by root, is writable by others,
// or is malformed is skipped with a log line, and so is an entry whose
// executable, or the directory holding it, could be changed by anyone but
// root (not root-owned, or group/world-writable): whoever can rewrite the
// program can act with its entitlements. That check is made when the entry is
// loaded and again whenever it is matched. Such entries give no identity
// rather than a wrong one. The directory is re-read when it changes.
//
// A process the launcher started as an app (a current signing-identifier
// record, see VSAProcessRecords) is that app whatever program it runs: its
// entry carries the recorded identifier, is sandboxed, and is marked
// `launched`, so that its entitlements are the ones the code-signing
// database holds for the identifier, not any registry file's.
// Thread-safe.
#pragma once

#include <ctime>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAValue.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSASystemRoot.h"

struct VSAClientRegistryEntry {
  std::string executable;  // host path of the executable, canonical
  // "Executable" resolved below the system root, before any link is followed.
  std::string rootPath;
  std::string signingIdentifier;
  VSAValue entitlements = VSAValue::dictionary();
  bool sandboxed = false;
  bool kernelBridge = false;
  uid_t user = 0;         // the uid the peer must have: "User", root when none is named
  bool launched = false;  // from a launcher's record: entitlements come from the database
};

class VSAClientRegistry {
 public:
  explicit VSAClientRegistry(VSASystemRoot root);

  std::string directory() const { return root_.resolve("/etc/vessad/clients.d"); }
  // The entry of the process named by `token`, if it is registered.
  std::optional<VSAClientRegistryEntry> entryForAuditToken(const VSAAuditToken& token);
  // The entry for a peer with audit token `token` whose executable's real
  // path is `executable` (already known to belong to that process).
  std::optional<VSAClientRegistryEntry> entryForPeer(const VSAAuditToken& token,
                                                     const std::string& executable);
  // The entry registered for a host executable path.
  std::optional<VSAClientRegistryEntry> entryForExecutable(const std::string& hostPath);
  // Every entry of this root whose "SigningIdentifier" is `signingIdentifier`.
  std::vector<VSAClientRegistryEntry> entriesForSigningIdentifier(
      const std::string& signingIdentifier);

 private:
  void reloadIfChanged();
  // The executable and its directory can be changed only by root; logs why not.
  static bool executableIsRootControlled(const std::string& hostPath, const std::string& origin);
  std::optional<VSAClientRegistryEntry> loadEntry(const std::string& file);

  VSASystemRoot root_;
  std::mutex mutex_;
  struct timespec loadedMTime_ = {-1, 0};
  std::map<std::string, VSAClientRegistryEntry> byExecutable_;
};
