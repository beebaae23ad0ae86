// Named POSIX semaphores that outlive the daemon until the host restarts.
//
// The first-boot marker "vessad.fb_check" is one: its existence says that
// first-boot work has completed since boot. For a system root other than
// "/" the name carries a hash of the root, so that roots do not share it.
#pragma once

#include <string>

#include "platform/VSASystemRoot.h"

class VSANamedSemaphore {
 public:
  static std::string nameForRoot(const std::string& baseName, const VSASystemRoot& root);
  // Opens the existing semaphore and closes it again: true when it exists.
  static bool exists(const std::string& name);
  // Creates it (mode 0444, value 0); on failure returns false with errno set.
  static bool create(const std::string& name);
  static void remove(const std::string& name);
};
