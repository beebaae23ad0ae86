// Notifications by name.
//
// A posted name is appended, one line each ("<unix time> <name>"), to the
// root's notification log `<root>/run/vessad/notifications.log`, which
// tests and `vessactl notifications` read. Appends are single writes with
// O_APPEND, so concurrent posts never interleave. Thread-safe.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/VSASystemRoot.h"

// Platform-defined notification names.
inline constexpr const char* CONTAINER_NOTIFY_CLEANUP_COMPLETE =
    "com.tamsk.vessad.cleanup-complete";
inline constexpr const char* CONTAINER_NOTIFY_REBOOT_CLEANUP_COMPLETE =
    "com.tamsk.vessad.reboot-cleanup-complete";
inline constexpr const char* CONTAINER_NOTIFY_USER_INVALIDATED =
    "com.tamsk.vessad.user-invalidated";

class VSANotificationCenter {
 public:
  explicit VSANotificationCenter(VSASystemRoot root);

  std::string logPath() const;
  // 0 on success, otherwise the errno of the failed append.
  uint32_t post(const std::string& name);
  // The names posted so far, oldest first.
  std::vector<std::string> postedNames() const;

 private:
  VSASystemRoot root_;
};
