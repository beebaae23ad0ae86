// The persona service of a system root.
//
// Personas are listed in `<root>/etc/vessad/personas.plist`: an array (or a
// dictionary with a "Personas" array) of records with "PersonaID" (number),
// "Kind" ("personal", "enterprise", "universal" or "system"),
// "UniqueString", "BundleIdentifiers" (array of strings) and "LayoutPath"
// (device path of an enterprise persona's home). A record with a field of
// the wrong type is logged and left out; a file that cannot be parsed gives
// no list. Without the file the device has one personal persona (id 1000,
// unique string "DEFAULT-PERSONAL-PERSONA").
//
// The launcher records each process it starts in a persona as
// `<root>/run/vessad/process-personas/<pid>`: "<start time> <persona id>".
// A process without a (current, root-owned) record runs in the personal
// persona. Changes of personas.plist are watched with inotify. The parsed
// list is kept while the file's identity (device, inode, size, modification
// time) stays the same, so a request costs at most one stat, not a parse.
// While an observer's watch is up, not even the stat: the kept list is
// trusted until the watch reports a change of the file, and for at most a
// second (a watch that lost its directory to a rename reports nothing more).
// Thread-safe.
#pragma once

#include <chrono>
#include <memory>
#include <mutex>

#include "base/VSAWorkQueue.h"
#include "platform/VSAInotifyWatcher.h"
#include "platform/VSAPersonaService.h"
#include "platform/VSASystemRoot.h"

inline constexpr uint32_t kVSADefaultPersonalPersonaID = 1000;
inline constexpr const char* kVSADefaultPersonalPersonaString = "DEFAULT-PERSONAL-PERSONA";

class VSALinuxPersonaService : public VSAPersonaService {
 public:
  explicit VSALinuxPersonaService(VSASystemRoot root);

  std::optional<std::vector<VSAPersonaAttributes>> listPersonas() override;
  std::optional<VSAPersonaAttributes> currentPersona() override;
  void registerObserver(const std::string& serviceName, std::function<void()> onChange,
                        std::function<void(VSAErrorRef)> completion) override;

  std::string personasPath() const { return root_.resolve("/etc/vessad/personas.plist"); }
  std::string processRecordPath(pid_t pid) const;
  // The persona id recorded for a process, when the record is current.
  std::optional<uint32_t> recordedPersonaID(pid_t pid, uint64_t startTime) const;

 private:
  struct FileStamp {
    uint64_t device = 0, inode = 0, size = 0;
    int64_t seconds = 0, nanoseconds = 0;
    bool operator==(const FileStamp&) const = default;
  };
  std::optional<std::vector<VSAPersonaAttributes>> readPersonas();
  // Makes the next listPersonas() look at the file again.
  void forgetTrust();

  VSASystemRoot root_;
  std::mutex cacheMutex_;
  std::optional<FileStamp> cachedStamp_;
  std::vector<VSAPersonaAttributes> cachedPersonas_;
  bool watched_ = false;  // a watch is up: the kept list may be trusted until...
  std::chrono::steady_clock::time_point trustedUntil_;  // ...this moment
  uint64_t changesHeard_ = 0;  // a look begun before a change does not renew trust
  std::mutex watcherMutex_;
  std::unique_ptr<VSAInotifyWatcher> watcher_;
};
