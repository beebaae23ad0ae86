#include "model/VSAPerUserConfiguration.h"

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "model/VSAGlobalConfiguration.h"

VSAPerUserConfiguration::VSAPerUserConfiguration(VSAUserIdentityRef userIdentity,
                                                 VSAGlobalConfiguration& global)
    : userIdentity_(std::move(userIdentity)), global_(global) {
  home_ = userIdentity_ ? userIdentity_->homeDirectoryURL() : std::string();
  if (home_.empty())
    VSALog(kVSALogFault, "initWithUserIdentity", "Home directory cannot be nil: %@", userIdentity_);
}

std::string VSAPerUserConfiguration::ensure(const std::string& path, const char* failureFormat) {
  return global_.ensureDirectory(path, userIdentity_ ? userIdentity_->posixUID() : 0,
                                 kVSANoProtectionClass, failureFormat,
                                 userIdentity_ ? userIdentity_->posixGID() : 0);
}

std::string VSAPerUserConfiguration::userBaseDirectory() {
  return ensure(VSAPathJoin(home_, "Containers"), "Failed to create user base dir at \"%@\": %@");
}

std::string VSAPerUserConfiguration::stagingDirectory() {
  return ensure(VSAPathJoin(userBaseDirectory(), "Staging"),
                "Failed to create staging dir at \"%@\": %@");
}

std::string VSAPerUserConfiguration::transientDirectory() {
  return ensure(VSAPathJoin(userBaseDirectory(), "Temp"),
                "Failed to create transient dir at \"%@\": %@");
}

std::string VSAPerUserConfiguration::libraryDirectory() {
  return ensure(VSAPathJoin(home_, "Library/Vessa"),
                "Failed to create user library dir at \"%@\": %@");
}

std::string VSAPerUserConfiguration::oldLoggingPath() const {
  return VSAPathJoin(home_, "Library/Logs/Vessa");
}

std::string VSAPerUserConfiguration::systemContainerBackupBaseDirectory() const {
  return VSAPathJoin(home_, "Library/Backup/SystemContainers");
}

std::string VSAPerUserConfiguration::systemContainerBackupDirectory() const {
  return VSAPathJoin(systemContainerBackupBaseDirectory(), "Data");
}

std::string VSAPerUserConfiguration::systemGroupContainerBackupDirectory() const {
  return VSAPathJoin(systemContainerBackupBaseDirectory(), "Shared");
}

bool VSAPerUserConfiguration::existsUserBaseDirectory() {
  return global_.fileManager().itemExistsAtURL(home_);
}

std::optional<std::string> VSAPerUserConfiguration::containerDirectoryURLForContentClass(
    VSAContainerClass c, bool transient) {
  std::lock_guard lock(monitor_);
  if (!VSAContainerClassIsPerUser(c)) {
    VSALog(kVSALogError, "containerDirectoryURLForContentClass",
           "Invalid class for a per user container directory: %llu", c);
    return std::nullopt;
  }
  std::string base = transient ? transientDirectory() : userBaseDirectory();
  return ensure(VSAPathJoin(base, VSAContainerClassPathComponent(c)),
                "Failed to create container dir at \"%@\": %@");
}
