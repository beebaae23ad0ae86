// The sandbox service of a system root: its per-user container table and
// its file extension tokens.
//
// Container table: per uid, the items the sandbox knows (item type,
// identifier, container class, kernel persona id, path), persisted in
// `<root>/run/vessad/sandbox/<uid>.plist` so that it outlives a daemon
// restart as the kernel's table would. Only classes with an item type
// (VSASandboxItemTypeForClass) may be stored. Changes apply to the table in
// memory at once (indexed by identifier and class); the files are rewritten
// by the service's writer thread, which gathers changes for a while before
// each rewrite: at least 100 ms, and ten times as long as the last rewrite
// took (at most 2 s), so that rewriting a large table never costs more than
// a tenth of the daemon's time however fast containers come and go.
// Destroying the service, or flush(), writes what is pending.
//
// Extension tokens: HMAC-SHA256 over (extension class, path, audit token)
// with a per-boot key kept in `<root>/run/vessad/sandbox-token.key` (0600).
// A launcher (or a test) verifies a token with verifyFileExtension. A token
// reads "<extension class>;<hex path>;<hex audit token>;<hex mac>".
// Thread-safe.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <tuple>
#include <utility>
#include <vector>

#include "base/VSAContainerClasses.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSASystemRoot.h"

struct VSASandboxItem {
  uint64_t itemType = 0;
  std::string identifier;
  VSAContainerClass containerClass = VSAClass::kUndefined;
  int32_t personaID = 0;
  std::string path;
};

// The sandbox's item type for a container class; nothing for classes the
// sandbox does not track (the bundle classes).
std::optional<uint64_t> VSASandboxItemTypeForClass(VSAContainerClass containerClass);

class VSASandboxService {
 public:
  explicit VSASandboxService(VSASystemRoot root);
  ~VSASandboxService();
  // Writes every changed table now.
  void flush();

  // Stores an item for `uid`, replacing the one of the same identifier, class
  // and persona (personas may share a uid); an absent path removes it.
  // Returns 0 or an errno.
  int setUserStateItem(uid_t uid, uint64_t itemType, const std::string& identifier,
                       VSAContainerClass containerClass, int32_t personaID,
                       const std::optional<std::string>& path);
  // Calls `block` for each item of `uid` until it answers false; 0 or an errno.
  int iterateUserStateItems(uid_t uid, const std::function<bool(const VSASandboxItem&)>& block);
  // The item of `uid` for `identifier`, `containerClass` and `personaID`.
  std::optional<VSASandboxItem> userStateItem(uid_t uid, const std::string& identifier,
                                              VSAContainerClass containerClass, int32_t personaID);

  // Issues a token granting `auditToken`'s process access to `path`.
  std::optional<std::string> issueFileExtension(const std::string& extensionClass,
                                                const std::string& path,
                                                const VSAAuditToken& auditToken);
  bool verifyFileExtension(const std::string& token, const std::string& extensionClass,
                           const std::string& path, const VSAAuditToken& auditToken);

 private:
  using Table = std::map<std::tuple<std::string, VSAContainerClass, int32_t>, VSASandboxItem>;

  std::string tablePath(uid_t uid) const;
  const Table& load(uid_t uid);  // caller holds mutex_
  void writerLoop();
  // Writes the changed tables; answers how long that took.
  std::chrono::steady_clock::duration writePending();
  int write(uid_t uid, const Table& items);
  bool key(std::string* out);
  std::string mac(const std::string& extensionClass, const std::string& path,
                  const VSAAuditToken& auditToken, const std::string& key) const;

  VSASystemRoot root_;
  std::mutex mutex_;
  std::map<uid_t, Table> tables_;
  std::set<uid_t> dirty_;
  std::condition_variable changed_;
  bool stopping_ = false;
  std::chrono::steady_clock::duration gatherInterval_ = std::chrono::milliseconds(100);
  // Held while a snapshot is taken and written, so files never go back in time.
  std::mutex writeMutex_;
  std::thread writer_;
  std::string key_;
};
