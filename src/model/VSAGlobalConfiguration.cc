#include "model/VSAGlobalConfiguration.h"

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "model/VSAPerUserConfiguration.h"

VSAGlobalConfiguration::VSAGlobalConfiguration(VSASystemRoot root,
                                               std::shared_ptr<const VSADeviceProperties> device,
                                               std::shared_ptr<const VSAUserDatabase> userDatabase,
                                               std::shared_ptr<VSAFileManager> fileManager)
    : root_(std::move(root)), device_(std::move(device)), fileManager_(std::move(fileManager)) {
  auto mobile = userDatabase ? userDatabase->userNamed("mobile") : std::nullopt;
  if (mobile) {
    mobileUID_ = mobile->uid;
    mobileGID_ = mobile->gid;
    VSALog(kVSALogNotice, "VSAGlobalConfiguration", "Current mobile user ID is %u, group ID is %u",
           mobileUID_, mobileGID_);
  } else {
    VSALog(kVSALogError, "VSAGlobalConfiguration", "Failed to get mobile uid. This is bad");
  }
}

VSAGlobalConfiguration::~VSAGlobalConfiguration() = default;

namespace {
// Paths remembered as ensured (a few per user and class; bounded all the same).
constexpr size_t kEnsuredDirectoriesLimit = 4096;
}  // namespace

std::string VSAGlobalConfiguration::ensureDirectory(const std::string& path, uid_t owner,
                                                    uint32_t protectionClass,
                                                    const char* failureFormat,
                                                    std::optional<gid_t> group) {
  bool known;
  {
    std::lock_guard lock(ensuredMutex_);
    known = ensured_.count(path) > 0;
  }
  if (known && fileManager_->directoryExistsAtURL(path)) return path;
  VSAErrorRef error;
  // Durable once made: containers, pending updates and journals are committed
  // into these directories by renames that sync the directory itself, not
  // the entries that name it and its parents; a class directory lost in a
  // power loss would take every container committed into it.
  if (!fileManager_->createDurableDirectoryAtURL(path, 0755, owner, protectionClass, &error,
                                                 group)) {
    VSALog(kVSALogError, "VSAGlobalConfiguration", failureFormat, path, error);
    std::lock_guard lock(ensuredMutex_);
    ensured_.erase(path);
    return path;
  }
  std::lock_guard lock(ensuredMutex_);
  if (ensured_.size() >= kEnsuredDirectoriesLimit) ensured_.clear();
  ensured_.insert(path);
  return path;
}

std::string VSAGlobalConfiguration::rootHomeDirectory() const {
  return root_.resolve("/private/var/root/");
}

std::string VSAGlobalConfiguration::sharedContainersDirectory() {
  return ensureDirectory(root_.resolve("/private/var/containers"), 0, kVSANoProtectionClass,
                         "Failed to create shared container dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::bundleDirectory() {
  return ensureDirectory(VSAPathJoin(sharedContainersDirectory(), "Bundle"), 0,
                         kVSANoProtectionClass, "Failed to create bundle dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::transientBundleDirectory() {
  return ensureDirectory(VSAPathJoin(sharedContainersDirectory(), "Temp"), 33,
                         kVSANoProtectionClass,
                         "Failed to create transient bundle dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::libraryDirectory() {
  return ensureDirectory(VSAPathJoin(rootHomeDirectory(), "Library/Vessa"), 0, 4,
                         "Failed to create library dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::pendingUpdatesDirectory() {
  return ensureDirectory(VSAPathJoin(libraryDirectory(), "PendingUpdates"), 0,
                         kVSANoProtectionClass, "Failed to create updates dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::replaceDirectory() {
  return ensureDirectory(VSAPathJoin(libraryDirectory(), "Replace"), 0, kVSANoProtectionClass,
                         "Failed to create replace dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::cachesDirectory() {
  return ensureDirectory(VSAPathJoin(rootHomeDirectory(), "Library/Caches/com.tamsk.vessad"), 0, 4,
                         "Failed to create cache dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::deathrowDirectory() {
  return ensureDirectory(VSAPathJoin(cachesDirectory(), "Dead"), 0, kVSANoProtectionClass,
                         "Failed to create deathrow dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::stagingDirectory() {
  return ensureDirectory(VSAPathJoin(cachesDirectory(), "Staging"), 0, kVSANoProtectionClass,
                         "Failed to create staging dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::transientDirectory() {
  return ensureDirectory(VSAPathJoin(cachesDirectory(), "Temp"), 0, kVSANoProtectionClass,
                         "Failed to create transient dir at \"%@\": %@");
}

std::string VSAGlobalConfiguration::logDirectoryForRoot(const VSASystemRoot& root) {
  return root.resolve("/private/var/root/Library/Logs/Vessa");
}

std::string VSAGlobalConfiguration::logDirectory() {
  return ensureDirectory(logDirectoryForRoot(root_), 0, 4,
                         "Failed to create log directory at \"%@\": %@");
}

std::optional<std::string> VSAGlobalConfiguration::legacyTransientBundleDirectory() {
  std::string path = root_.resolve("/private/var/ferroxd/Library/Caches/com.tamsk.vessad");
  if (!fileManager_->itemExistsAtURL(path)) return std::nullopt;
  return path;
}

const std::vector<std::string>& VSAGlobalConfiguration::appUserDataItemNames() {
  static const std::vector<std::string> names = {"Documents", "Library", "tmp", "StoreKit"};
  return names;
}

const std::vector<std::string>& VSAGlobalConfiguration::excludedFromAppUserData() {
  static const std::vector<std::string> names = {"SystemData"};
  return names;
}

std::optional<std::string> VSAGlobalConfiguration::globalContainerBaseURLWithContentClass(
    VSAContainerClass c, bool transient) {
  bool bundle = VSAContainerClassIsBundle(c), system = VSAContainerClassIsSystem(c);
  if (!bundle && !system) return std::nullopt;
  std::string base = !transient ? sharedContainersDirectory()
                     : bundle   ? transientBundleDirectory()
                                : transientDirectory();
  return VSAPathJoin(base, VSAContainerClassPathComponent(c));
}

std::optional<std::string> VSAGlobalConfiguration::containerDirectoryURLForUserIdentity(
    const VSAUserIdentityRef& userIdentity, VSAContainerClass c, bool transient) {
  std::lock_guard lock(monitor_);
  if (auto global = globalContainerBaseURLWithContentClass(c, transient)) {
    return ensureDirectory(*global, VSAContainerClassIsBundle(c) ? 33 : 0, kVSANoProtectionClass,
                           "Failed to create container dir at \"%@\": %@");
  }
  auto perUser = getPerUserConfigurationForUserIdentity(userIdentity);
  if (!perUser) return std::nullopt;
  return perUser->containerDirectoryURLForContentClass(c, transient);
}

std::string VSAGlobalConfiguration::stagingDirectoryURLForUserIdentity(
    const VSAUserIdentityRef& userIdentity, VSAContainerClass c) {
  if (VSAContainerClassIsPerUser(c)) {
    if (auto perUser = getPerUserConfigurationForUserIdentity(userIdentity))
      return perUser->stagingDirectory();
  }
  return stagingDirectory();
}

bool VSAGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
  return fileManager_->itemExistsAtURL(VSAPathJoin(libraryDirectory(), name));
}

std::shared_ptr<VSAPerUserConfiguration>
VSAGlobalConfiguration::getPerUserConfigurationForUserIdentity(
    const VSAUserIdentityRef& userIdentity) {
  if (!userIdentity) return nullptr;
  std::lock_guard lock(perUserMutex_);
  auto& slot = perUser_[userIdentity->identifier()];
  if (!slot) slot = std::make_shared<VSAPerUserConfiguration>(userIdentity, *this);
  return slot;
}

bool VSAGlobalConfiguration::isInternalImage() {
  std::lock_guard lock(monitor_);
  if (!internalImageComputed_) {
    internalImage_ = device_ && device_->hasInternalContent();
    internalImageComputed_ = true;
  }
  return internalImage_;
}

void VSAGlobalConfiguration::setIsInternalImage(bool value) {
  std::lock_guard lock(monitor_);
  internalImage_ = value;
}
