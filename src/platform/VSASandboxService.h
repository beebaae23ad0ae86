// The sandbox service of a system root: its per-user container table and
// its file extension tokens.
//
// Container table: per uid, the items the sandbox knows (item type,
// identifier, container class, kernel persona id, path), persisted under
// `<root>/run/vessad/sandbox/` so that it outlives a daemon restart as the
// kernel's table would. Only classes with an item type
// (VSASandboxItemTypeForClass) may be stored. Changes apply to the table in
// memory at once (indexed by identifier and class) and are numbered; the
// service's writer thread, which gathers changes for a while (at least
// 100 ms, and ten times as long as its last write took, at most 2 s),
// appends them to `<uid>.log`, so that a change costs its own bytes however
// large the table is. When the log has grown past the table's own size (and
// 64 KiB), the table is written whole to `<uid>.plist` with the number of
// the last change it holds, and the log starts again; reading takes the
// table and then the log's changes numbered after it (a change the table
// already holds is skipped, and a record cut short ends the log).
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
  using Key = std::tuple<std::string, VSAContainerClass, int32_t>;
  using Table = std::map<Key, VSASandboxItem>;
  // One numbered change: an item stored, or (no path) removed.
  struct Change {
    uint64_t sequence = 0;
    VSASandboxItem item;
    bool removal = false;
  };
  struct UserTable {
    Table items;
    uint64_t sequence = 0;          // the number of the last change applied
    std::vector<Change> unwritten;  // applied here, not yet in the files
    uint64_t logBytes = 0;          // the log's valid length
    uint64_t tableBytes = 0;        // the size of the table file last written or read
    bool rewrite = false;           // the log cannot be appended to: write the table whole
  };
  // What the writer takes from a table under the lock and writes outside it.
  struct Work {
    std::vector<Change> changes;
    std::optional<Table> whole;  // set when the table is written whole
    uint64_t sequence = 0;
  };

  std::string tablePath(uid_t uid) const;
  std::string logPath(uid_t uid) const;
  // The table of `uid`, read from its files the first time; null (and
  // `*rc` an errno) when they could not be read: nothing is cached then, so
  // the next call reads again rather than start over from an empty table.
  UserTable* load(uid_t uid, int* rc);  // caller holds mutex_
  static void apply(Table& items, const Change& change);
  // Replays the log's changes numbered after the table's; false when the
  // log ends in a record cut short or unreadable (the table is then written
  // whole at the next write, and the log started again).
  static bool replayLog(const std::vector<uint8_t>& log, UserTable& table);
  void writerLoop();
  // Writes the changed tables; answers how long that took. A table whose
  // write failed stays changed (written whole next time), and the writer
  // waits longest before trying again.
  std::chrono::steady_clock::duration writePending(bool* failed = nullptr);
  // Appends `changes` to the log (bytes appended, or an errno as negative).
  int64_t appendToLog(uid_t uid, const std::vector<Change>& changes);
  // Writes the table whole and empties the log (the table's size, or a negative errno).
  int64_t writeWhole(uid_t uid, const Table& items, uint64_t sequence);
  bool key(std::string* out);
  std::string mac(const std::string& extensionClass, const std::string& path,
                  const VSAAuditToken& auditToken, const std::string& key) const;

  VSASystemRoot root_;
  std::mutex mutex_;
  std::map<uid_t, UserTable> tables_;
  std::set<uid_t> dirty_;
  std::condition_variable changed_;
  bool stopping_ = false;
  std::chrono::steady_clock::duration gatherInterval_ = std::chrono::milliseconds(100);
  // Held while a snapshot is taken and written, so files never go back in time.
  std::mutex writeMutex_;
  std::thread writer_;
  std::string key_;
};
