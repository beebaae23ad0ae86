// The sandbox service of a system root: its per-user container table and
// its file extension tokens.
//
// Container table: per uid, the items the sandbox knows (item type,
// identifier, container class, kernel persona id, path), persisted in
// `<root>/run/vessad/sandbox/<uid>.plist` so that it outlives a daemon
// restart as the kernel's table would. Only classes with an item type
// (VSASandboxItemTypeForClass) may be stored. Changes apply to the table in
// memory at once; the files are rewritten on the service's own serial queue,
// several changes coalescing into one write (so a burst of creations costs
// one rewrite, not one per container). Destroying the service, or flush(),
// writes what is pending.
//
// Extension tokens: HMAC-SHA256 over (extension class, path, audit token)
// with a per-boot key kept in `<root>/run/vessad/sandbox-token.key` (0600).
// A launcher (or a test) verifies a token with verifyFileExtension. A token
// reads "<extension class>;<hex path>;<hex audit token>;<hex mac>".
// Thread-safe.
#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "base/VSAWorkQueue.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSASystemRoot.h"

struct VSASandboxItem {
  uint64_t itemType = 0;
  std::string identifier;
  uint64_t containerClass = 0;
  int32_t personaID = 0;
  std::string path;
};

// The sandbox's item type for a container class; nothing for classes the
// sandbox does not track (the bundle classes).
std::optional<uint64_t> VSASandboxItemTypeForClass(uint64_t containerClass);

class VSASandboxService {
 public:
  explicit VSASandboxService(VSASystemRoot root);
  ~VSASandboxService();
  // Writes every changed table now.
  void flush();

  // Stores an item for `uid`, replacing the one of the same identifier and
  // class; an absent path removes it. Returns 0 or an errno.
  int setUserStateItem(uid_t uid, uint64_t itemType, const std::string& identifier,
                       uint64_t containerClass, int32_t personaID,
                       const std::optional<std::string>& path);
  // Calls `block` for each item of `uid` until it answers false; 0 or an errno.
  int iterateUserStateItems(uid_t uid, const std::function<bool(const VSASandboxItem&)>& block);

  // Issues a token granting `auditToken`'s process access to `path`.
  std::optional<std::string> issueFileExtension(const std::string& extensionClass,
                                                const std::string& path,
                                                const VSAAuditToken& auditToken);
  bool verifyFileExtension(const std::string& token, const std::string& extensionClass,
                           const std::string& path, const VSAAuditToken& auditToken);

 private:
  std::string tablePath(uid_t uid) const;
  const std::vector<VSASandboxItem>& load(uid_t uid);  // caller holds mutex_
  // Marks `uid`'s table changed and schedules a write (caller holds mutex_).
  void _lock_scheduleWrite(uid_t uid);
  void writePending();
  int write(uid_t uid, const std::vector<VSASandboxItem>& items);
  bool key(std::string* out);
  std::string mac(const std::string& extensionClass, const std::string& path,
                  const VSAAuditToken& auditToken, const std::string& key) const;

  VSASystemRoot root_;
  std::mutex mutex_;
  std::map<uid_t, std::vector<VSASandboxItem>> tables_;
  std::set<uid_t> dirty_;
  bool writeScheduled_ = false;
  VSAWorkQueue::Ref writeQueue_ = VSAWorkQueue::create("com.tamsk.vessad.sandbox-table");
  std::string key_;
};
