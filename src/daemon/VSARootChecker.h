// The root checker: reads a system root while no daemon serves it and says
// whether it is in order - what an integrator runs after a crash, and what
// the crash tests run after every restart.
//
// It looks, and changes nothing: the root is read through a file-system
// layer that refuses every change, and the code-signing database is opened
// read-only. What it checks:
//   - every entry of every class directory (each user with a home, each
//     global class; live and transient) is a container: a valid name, a
//     metadata file that reads back and validates for that place, the
//     owner and mode creation gives it (system
//     containers: their ACL); an entry without a metadata file, or with a
//     name no container has, is an orphan the next boot's cleanup removes;
//   - identities are unique: one container per (user, class, identifier,
//     live or transient), and no UUID twice among the live containers (nor
//     among the transient ones: a wipe's transient copy shares its UUID);
//   - nothing is left in staging or in the replace journals (each start
//     finishes or undoes them), and no half-written state file;
//   - every pending protection update reads back and names a live container;
//   - nothing that death row moved aside waits in the root's /tmp (counted
//     as "tmpLeftovers" and "tmpLeftoverBytes");
//   - the code-signing database passes SQLite's integrity check.
// Each finding names its kind, the path, what is wrong and what brings it
// into order. Notes are what is worth knowing but not wrong: an
// application-group container that no identifier's entitlements name (the
// kernel may ask for groups the database does not list; reconciliation
// removes them). Not thread-safe; one check per object.
#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "model/VSAContainerClass.h"
#include "model/VSAUserIdentity.h"

struct VSADaemonContext;

struct VSARootFinding {
  std::string kind;              // "orphan", "invalid-metadata", "duplicate-identity", ...
  std::string path;              // what it is about
  std::string detail;            // what is wrong
  std::string repair;            // what brings it into order
  bool repairedAtStart = false;  // the daemon's next start (not only a boot) repairs it
};

class VSARootChecker {
 public:
  enum Status { kClean = 0, kFindings = 1, kUnreadable = 2 };

  explicit VSARootChecker(const std::string& rootPath);
  ~VSARootChecker();

  Status check();
  const std::vector<VSARootFinding>& findings() const { return findings_; }
  const std::vector<VSARootFinding>& notes() const { return notes_; }
  // What was seen: "containers", "orphans", "deathRowEntries", ...
  const std::map<std::string, uint64_t>& counts() const { return counts_; }
  // Why the root could not be read (kUnreadable).
  const std::string& unreadableReason() const { return unreadable_; }
  std::string text() const;
  std::string json() const;

 private:
  void checkClassDirectory(const VSAUserIdentityRef& user, VSAContainerClass c, bool transient);
  void checkEntry(const VSAUserIdentityRef& user, VSAContainerClass c, bool transient,
                  const std::string& directory, const std::string& name);
  // `st`: the container directory's own status, already taken by checkEntry.
  void checkOwnership(const std::string& path, const struct stat& st,
                      const VSAUserIdentityRef& user, VSAContainerClass c);
  static std::string identityKey(const VSAUserIdentityRef& user, VSAContainerClass c,
                                 bool transient, const std::string& identifier);
  void checkLeftovers(const std::string& directory, const char* kind, const char* repair);
  void checkTempLeftovers();
  void checkPendingUpdates();
  void checkDatabase();
  void add(const char* kind, const std::string& path, std::string detail, const char* repair);

  std::string rootPath_;
  std::unique_ptr<VSADaemonContext> context_;
  std::vector<VSARootFinding> findings_;
  std::vector<VSARootFinding> notes_;
  std::map<std::string, uint64_t> counts_;
  std::string unreadable_;
  // (user identifier, class, transient, identifier) -> path, and
  // (transient, UUID) -> path.
  std::map<std::string, std::string> identities_;
  std::map<std::string, std::string> uuids_;
  // Application-group containers seen: identifier -> paths.
  std::map<std::string, std::vector<std::string>> appGroups_;
};
