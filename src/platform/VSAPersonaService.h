// The persona service: which personas the device has and which one the
// calling thread runs as.
//
// A persona record carries its kind (personal, enterprise, universal,
// system), its unique string, its kernel persona id, the bundle identifiers
// of the apps it runs and, for enterprise personas, the layout path of its
// home directory. The "current persona of the calling thread" is the persona
// of the client whose request the thread is serving (see
// VSACurrentPersonaScope); a thread serving nobody has no current persona.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"

struct VSAPersonaAttributes {
  enum class Kind { Personal, Enterprise, Universal, System };
  Kind kind = Kind::Personal;
  uint32_t personaID = 0;
  std::optional<std::string> uniqueString;
  std::optional<std::vector<std::string>> bundleIdentifiers;
  std::optional<std::string> layoutPath;  // host path

  bool isPersonal() const { return kind == Kind::Personal; }
  bool isEnterprise() const { return kind == Kind::Enterprise; }
  bool isUniversal() const { return kind == Kind::Universal; }
  bool isSystem() const { return kind == Kind::System; }
  std::string description() const;
};

class VSAPersonaService {
 public:
  virtual ~VSAPersonaService() = default;
  // Every persona with its attributes; nothing when the list cannot be had.
  virtual std::optional<std::vector<VSAPersonaAttributes>> listPersonas() = 0;
  // The persona of the calling thread; nothing when it runs as none.
  virtual std::optional<VSAPersonaAttributes> currentPersona() = 0;
  // Calls `onChange` after every change of the persona list; the completion
  // reports whether registration worked.
  virtual void registerObserver(const std::string& serviceName, std::function<void()> onChange,
                                std::function<void(VSAErrorRef)> completion) = 0;
};

// A process's persona record as one connection read it: a client's identity
// is fixed when it connects, so its first request reads the record and later
// requests on the same connection reuse the answer (a record that is absent
// is remembered as absent). Thread-safe.
class VSAPersonaRecordMemo {
 public:
  // The remembered answer, or `read()`'s, remembered.
  std::optional<uint32_t> get(const std::function<std::optional<uint32_t>()>& read);

 private:
  std::mutex mutex_;
  bool known_ = false;
  std::optional<uint32_t> persona_;
};

// While alive, the calling thread serves the process `pid` (started at
// `startTime`): the persona service answers that process's persona as the
// thread's current persona, through `memo` when one is given. Scopes nest.
class VSACurrentPersonaScope {
 public:
  VSACurrentPersonaScope(pid_t pid, uint64_t startTime, VSAPersonaRecordMemo* memo = nullptr);
  ~VSACurrentPersonaScope();
  VSACurrentPersonaScope(const VSACurrentPersonaScope&) = delete;
  VSACurrentPersonaScope& operator=(const VSACurrentPersonaScope&) = delete;

  // The process the calling thread serves, if any.
  static std::optional<std::pair<pid_t, uint64_t>> current();
  // The memo of the connection the calling thread serves, if any.
  static VSAPersonaRecordMemo* currentMemo();

 private:
  std::optional<std::pair<pid_t, uint64_t>> previous_;
  VSAPersonaRecordMemo* previousMemo_;
};
