// What the launcher records of each process it starts, for the daemon.
//
// One root-owned file per process and kind below `<root>/run/vessad/`:
//   process-personas/<pid>             "<start time> <persona id>"
//   process-signing-identifiers/<pid>  "<start time> <code-signing identifier>"
// The start time (clock ticks since boot, as in the audit token) ties a
// record to one process: a reused pid never matches an old record, and a
// process keeps its record across exec. Records are written by renaming a
// complete temporary file into place, so a reader never sees half of one,
// and read with a bounded, non-blocking, no-follow read whose owner is
// checked on the descriptor read: a file that is not root's counts as absent.
// Value type; thread-safe.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>

#include "platform/VSAAuditToken.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSAUniqueFd.h"

enum class VSAProcessRecordKind { Persona, SigningIdentifier };

class VSAProcessRecords {
 public:
  explicit VSAProcessRecords(VSASystemRoot root) : root_(std::move(root)) {}

  std::string directory(VSAProcessRecordKind kind) const;
  std::string path(VSAProcessRecordKind kind, pid_t pid) const;
  // The value recorded for the process `pid` started at `startTime`; nothing
  // when there is no current, root-owned, well-formed record.
  std::optional<std::string> read(VSAProcessRecordKind kind, pid_t pid, uint64_t startTime) const;
  // The record of the process, or else of its nearest recorded ancestor
  // that runs as the same (non-root) user, at most 16 generations up: what
  // an app starts is the app. A parent that exits hands its children to
  // another process, so the chain is read again after each record: a pid
  // reused meanwhile never lends its record.
  std::optional<std::string> readForProcessOrAncestor(VSAProcessRecordKind kind, pid_t pid,
                                                      uint64_t startTime) const;
  // Records `value` (one word: no white space, at most 255 bytes) for the
  // process; creates the directory (root's, 0755) when missing. 0 or an errno.
  // (The launcher's child records itself: VSAOwnProcessRecord.)
  int write(VSAProcessRecordKind kind, pid_t pid, uint64_t startTime,
            const std::string& value) const;
  // Removes the record of `pid` if it still names the process started at
  // `startTime` (a later process with the same pid keeps its own).
  void remove(VSAProcessRecordKind kind, pid_t pid, uint64_t startTime) const;

  // A value a record can hold.
  static bool isRecordableValue(const std::string& value);

  // The kind's directory, opened without following a link and made (root's,
  // 0755) when missing; 0 or an errno.
  int openDirectory(VSAProcessRecordKind kind, VSAUniqueFd* directory) const;
  // Writes the record into an opened directory: "<pid>.recording" written
  // whole, then renamed to "<pid>". Allocates nothing, so that a process can
  // record itself between clone and exec. 0 or an errno.
  static int writeAt(int directory, pid_t pid, uint64_t startTime, const char* value);

 private:
  VSASystemRoot root_;
};

// A record a process writes for itself between clone and exec, where it
// shares its parent's memory and may not allocate: the directory and the
// value are prepared first, the process adds its own pid and start time.
class VSAOwnProcessRecord {
 public:
  // 0 or an errno (EINVAL: a value no record can hold).
  int prepare(const VSAProcessRecords& records, VSAProcessRecordKind kind,
              const std::string& value);
  // Records the calling process. Allocates nothing; 0 or an errno.
  int writeForSelf() const;
  // Removes the record of `child`, which has ended but is not reaped yet:
  // until it is, no other process can hold its pid.
  void removeForUnreapedChild(pid_t child) const;

 private:
  VSAUniqueFd directory_;
  std::string value_;
};
