// Named POSIX semaphores that outlive the daemon until the host restarts.
//
// The first-boot marker "vessad.fb_check" is one: its existence says that
// first-boot work has completed since boot. For a system root other than
// "/" the name carries a hash of the root, so that roots do not share it.
//
// The semaphores live as files in the shared-memory directory, which every
// local user can write: anyone could make the marker and so have the daemon
// skip its first-boot work. A marker therefore counts only when the daemon's
// own user made it, with mode 0600 (which create() gives it); anything else
// under that name is "forged": the caller removes it and does the work.
#pragma once

#include <string>

#include "platform/VSASystemRoot.h"

class VSANamedSemaphore {
 public:
  enum class State { Absent, Present, Forged };

  static std::string nameForRoot(const std::string& baseName, const VSASystemRoot& root);
  // Present only for a regular file owned by this process's user with mode
  // 0600; examined without following a link or blocking.
  static State stateOf(const std::string& name);
  // stateOf() == Present.
  static bool exists(const std::string& name);
  // Creates it afresh (mode 0600, value 0); on failure returns false with
  // errno set (EEXIST when something took the name first).
  static bool create(const std::string& name);
  static void remove(const std::string& name);
  // The file that backs the semaphore (for diagnostics and tests).
  static std::string backingPath(const std::string& name);
};
