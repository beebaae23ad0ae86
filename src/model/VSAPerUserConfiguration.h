// The directory layout below one user's home: the per-user container base
// ("Containers"), its staging and transient trees, the user's library and
// the system-container backups. Directories are (re)created on each request
// owned by the user's uid, mode 0755. Thread-safe (its own monitor).
#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "model/VSAContainerClass.h"
#include "model/VSAUserIdentity.h"

class VSAGlobalConfiguration;

class VSAPerUserConfiguration {
 public:
  // initWithUserIdentity:
  VSAPerUserConfiguration(VSAUserIdentityRef userIdentity, VSAGlobalConfiguration& global);

  const VSAUserIdentityRef& userIdentity() const { return userIdentity_; }
  const std::string& userHomeDirectory() const { return home_; }
  std::string userBaseDirectory();
  std::string stagingDirectory();
  std::string transientDirectory();
  std::string libraryDirectory();
  std::string oldLoggingPath() const;
  std::string systemContainerBackupBaseDirectory() const;
  std::string systemContainerBackupDirectory() const;
  std::string systemGroupContainerBackupDirectory() const;
  // Whether the user's *home* exists (not its "Containers").
  bool existsUserBaseDirectory();
  // Classes 2, 4, 6, 7, 9, 10, 11 only; nothing (logged) for any other.
  std::optional<std::string> containerDirectoryURLForContentClass(VSAContainerClass contentClass,
                                                                  bool transient);

 private:
  std::string ensure(const std::string& path, const char* failureFormat);

  VSAUserIdentityRef userIdentity_;
  VSAGlobalConfiguration& global_;
  std::string home_;
  std::recursive_mutex monitor_;
};
