// The daemon's global directory layout and the device's mobile user.
//
// The one module that owns paths: every directory is a device path resolved
// below the system root, computed once, and (re)created on each request with
// mode 0755 (and the owner and protection class its row names), so a
// directory removed behind the daemon's back comes back the next time it is
// asked for; creation failures are logged and the path is still returned.
// Per-user layouts come from getPerUserConfigurationForUserIdentity, one
// object per user identity identifier. Thread-safe (a monitor guards the map
// and the container-directory call; lock order: global before per-user).
#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

#include "model/VSAContainerClass.h"
#include "model/VSAUserIdentity.h"
#include "platform/VSADeviceProperties.h"
#include "platform/VSAFileManager.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSAUserDatabase.h"

class VSAPerUserConfiguration;

class VSAGlobalConfiguration {
 public:
  // Reads the "mobile" account once, here.
  VSAGlobalConfiguration(VSASystemRoot root, std::shared_ptr<const VSADeviceProperties> device,
                         std::shared_ptr<const VSAUserDatabase> userDatabase,
                         std::shared_ptr<VSAFileManager> fileManager);
  ~VSAGlobalConfiguration();

  const VSASystemRoot& systemRoot() const { return root_; }
  VSAFileManager& fileManager() const { return *fileManager_; }
  uid_t currentMobileUserId() const { return mobileUID_; }
  gid_t currentMobileGroupId() const { return mobileGID_; }
  bool isInternalImage();
  void setIsInternalImage(bool value);

  std::string rootHomeDirectory() const;  // "/private/var/root/"
  std::string sharedContainersDirectory();
  std::string bundleDirectory();
  std::string transientBundleDirectory();
  std::string libraryDirectory();
  std::string pendingUpdatesDirectory();
  std::string replaceDirectory();
  std::string cachesDirectory();
  std::string deathrowDirectory();
  std::string stagingDirectory();
  std::string transientDirectory();
  std::string logDirectory();
  // The same directory, known before any configuration exists (the daemon
  // opens its log first).
  static std::string logDirectoryForRoot(const VSASystemRoot& root);
  std::optional<std::string> legacyTransientBundleDirectory();

  static const std::vector<std::string>& appUserDataItemNames();
  static const std::vector<std::string>& excludedFromAppUserData();

  // The base directory of containers of `contentClass` for `userIdentity`.
  std::optional<std::string> containerDirectoryURLForUserIdentity(
      const VSAUserIdentityRef& userIdentity, VSAContainerClass contentClass, bool transient);
  // Bundle and system classes only; nothing for any other class.
  std::optional<std::string> globalContainerBaseURLWithContentClass(VSAContainerClass contentClass,
                                                                    bool transient);
  std::string stagingDirectoryURLForUserIdentity(const VSAUserIdentityRef& userIdentity,
                                                 VSAContainerClass contentClass);
  bool migrationFileExistsWithName(const std::string& name);
  std::shared_ptr<VSAPerUserConfiguration> getPerUserConfigurationForUserIdentity(
      const VSAUserIdentityRef& userIdentity);

  // Creates `path` (mode 0755, parents too); logs `failureFormat` on failure.
  // A directory it makes goes to `owner` and `group` (default: the owner's
  // primary group). The path comes back either way: whatever acts on it next
  // goes through the file system, which refuses a link in its way. A path
  // ensured before costs one status call while it is still a directory; one
  // that went missing (or became anything else) is ensured again.
  std::string ensureDirectory(const std::string& path, uid_t owner, uint32_t protectionClass,
                              const char* failureFormat, std::optional<gid_t> group = {});

 private:
  VSASystemRoot root_;
  std::shared_ptr<const VSADeviceProperties> device_;
  std::shared_ptr<VSAFileManager> fileManager_;
  uid_t mobileUID_ = 0;
  gid_t mobileGID_ = 0;
  std::recursive_mutex monitor_;
  bool internalImageComputed_ = false;
  bool internalImage_ = false;
  std::mutex perUserMutex_;
  std::map<std::string, std::shared_ptr<VSAPerUserConfiguration>> perUser_;
  std::mutex ensuredMutex_;
  std::unordered_set<std::string> ensured_;  // paths ensured without an error
};
