// The executable a peer process ran when its connection was accepted.
//
// A pid and its start time survive execve, so they alone cannot tell that a
// connected process has since replaced its program (or that a process holding
// the socket is now running someone else's). The file the process executes is
// pinned by device and inode from /proc/<pid>/exe; isRunBy() checks that the
// process named by an audit token still runs that very file. `path` is the
// kernel's resolved path of the executable, kept only when it names the same
// file as the process runs (a replaced or deleted file leaves it empty, so it
// matches no registry entry). Value type.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/VSAAuditToken.h"

struct VSAPeerExecutable {
  std::string path;
  dev_t device = 0;
  ino_t inode = 0;

  // Pins the executable of the process named by `token`; nothing when the
  // process is gone (or is no longer the one the token names) or its
  // executable cannot be examined.
  static std::optional<VSAPeerExecutable> ofProcess(const VSAAuditToken& token);
  // The process named by `token` is still alive and still runs this file.
  bool isRunBy(const VSAAuditToken& token) const;
  // An open /proc/<pid> directory (O_PATH) of the process `token` names, or
  // -1. It stands for that very process: once the process is gone, lookups
  // through it fail even if its pid has been given to another.
  static int openProcessDirectory(const VSAAuditToken& token);
  // Like isRunBy(), for the process `processDirectory` stands for: one
  // status call instead of re-reading the start time on every check.
  bool isRunByProcessAt(int processDirectory) const;
  std::string description() const;
};
