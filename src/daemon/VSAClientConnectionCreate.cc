// Create or look up a container: the access tests, the locked lookup, and
// creation in staging followed by one rename into place.
#include <exception>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSAEntitlements.h"

namespace {
const char* const kOrigin = "createOrLookupContainerWithContainerIdentity";
constexpr VSAResultCode kTransientRemovalFailed = 5;
constexpr VSAResultCode kStagingCreateFailed = 7;
constexpr VSAResultCode kStagingMoveFailed = 8;
constexpr VSAResultCode kStagingRemovalFailed = 9;
constexpr VSAResultCode kException = 40;
constexpr VSAResultCode kCacheAddFailed = 45;

const char* const kLookupKeys[] = {nullptr,  "app",     "appData",    "plugin",     "pluginData",
                                   "vpn",    "vpnData", "appGroup",   "framework",  "relayService",
                                   "daemon", "tempDir", "systemData", "systemGroup"};

VSAErrorRef failure(VSAResultCode code, VSAErrorRef underlying, std::string message) {
  auto e = VSAError::make(code, std::move(underlying), kOrigin, __LINE__, "%@", message);
  VSALog(kVSALogError, kOrigin, "%@", message);
  return e;
}

// Holds the all-identifiers lock in one mode at a time, released on every path.
class GlobalLock {
 public:
  explicit GlobalLock(bool useLocking) : useLocking_(useLocking) {}
  ~GlobalLock() { release(); }
  void acquire(bool writing) {
    if (!useLocking_) return;
    release();
    writing ? lock_all_identifiers_write() : lock_all_identifiers_read();
    held_ = true;
  }
  void release() {
    if (held_) unlock_all_identifiers();
    held_ = false;
  }

 private:
  bool useLocking_;
  bool held_ = false;
};

bool isNotFound(const VSAErrorRef& e) {
  return e && e->domain() == kVSAErrorDomain && e->code() == VSAResult::kContainerNotFound;
}
}  // namespace

std::optional<std::set<std::string>> VSAClientConnection::_lookupForContainerClass(
    VSAContainerClass c) {
  if (c == 0 || c > 13) return std::nullopt;
  std::lock_guard lock(lookupCacheMutex_);
  if (!lookup_) return std::nullopt;
  if (!lookupCache_) lookupCache_.emplace();
  const char* key = kLookupKeys[c];
  auto it = lookupCache_->find(key);
  if (it != lookupCache_->end()) return it->second;
  std::set<std::string> ids;
  const VSAValue* value = lookup_->get(key);
  if (value && value->isArray())
    for (const auto& item : *value->arrayValue())
      if (item.isString()) ids.insert(*item.stringValue());
  return (*lookupCache_)[key] = std::move(ids);
}

bool VSAClientConnection::isEntitledForLookupWithClass(VSAContainerClass c,
                                                       const std::string& identifier) {
  auto ids = _lookupForContainerClass(c);
  return ids && ids->count(identifier) > 0;
}

int32_t VSAClientConnection::_dataProtectionClassForContainerMetadata(const VSAMetadata& metadata) {
  if (!VSAContainerClassIsPerUser(metadata.containerClass())) return 0;
  const VSAValue* recorded =
      metadata.info() ? metadata.info()->get(kVSAContentProtectionClassInfoKey) : nullptr;
  if (recorded && recorded->isInteger())
    return static_cast<int32_t>(recorded->int64Value().value_or(0));
  return context_.dataProtectionManager
      ->intendedDataProtectionClassBasedOnEntitlementsForIdentifier(metadata.identifier());
}

bool VSAClientConnection::_createTopLevelContainerDirectory(const std::string& url,
                                                            VSAContainerClass c, uid_t owner,
                                                            gid_t group, VSAErrorRef* error) {
  if (VSAContainerClassIsBundle(c))
    owner = CONTAINER_INSTALLATION_UID;
  else if (VSAContainerClassIsSystem(c))
    owner = 0;
  return context_.fileManager->createDirectoryAtURL(url, true, 0755, owner, 0, error, group);
}

bool VSAClientConnection::_createSubDirectories(const std::string& url, const VSAMetadata& metadata,
                                                VSAErrorRef* error) {
  VSAContainerClass c = metadata.containerClass();
  bool system = VSAContainerClassIsSystem(c);
  mode_t mode = system ? 0 : 0755;
  uid_t owner = VSAContainerClassIsBundle(c) ? CONTAINER_INSTALLATION_UID
                : system                     ? kVSANobodyID
                         : metadata.userIdentity()->posixUIDForContainerClass(c);
  gid_t group = system ? kVSANobodyID : metadata.userIdentity()->posixGIDForContainerClass(c);
  VSAResultCode libraryError = VSAResult::kSuccess;
  auto names = context_.subdirectories->subdirectoriesForClass(c, &libraryError);
  if (!names) {
    auto e = VSA_ERROR(libraryError, "Failed to get subdirectory names for %llu : %llu",
                       static_cast<unsigned long long>(c), libraryError);
    VSALog(kVSALogError, __func__, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  int32_t protection = _dataProtectionClassForContainerMetadata(metadata);
  VSALog(kVSALogDebug, __func__, "Creating subdirectories for [%llu:%@] at [%@]",
         static_cast<unsigned long long>(c), metadata.identifier(), url);
  const auto& excluded = VSAGlobalConfiguration::excludedFromAppUserData();
  for (const auto& name : *names) {
    int32_t itemClass = protection;
    if (VSAContainerClassIsPerUser(c) &&
        std::find(excluded.begin(), excluded.end(), name) != excluded.end())
      itemClass = 0;
    std::string path = VSAPathJoin(url, name);
    VSAErrorRef underlying;
    // A system sub-directory made with mode 0 inherits the ACL under a mask
    // of none; setting its ACL again makes the "systemusers" entry count.
    if (!context_.fileManager->createDirectoryAtURL(
            path, true, mode, owner, static_cast<uint32_t>(itemClass), &underlying, group) ||
        (system && !context_.fileManager->setSystemContainerDirectoryACLAtURL(path, &underlying))) {
      auto e = VSA_ERROR_UNDERLYING(underlying->resultCode(kStagingCreateFailed), underlying,
                                    "Failed to create sub-dir for %@ at %@ (protClass: %d)", name,
                                    url, itemClass);
      VSALog(kVSALogError, __func__, "%@", e->message());
      VSASetError(error, e);
      return false;
    }
  }
  return true;
}

namespace {
struct CreateSteps {
  VSAClientConnection& connection;
  VSADaemonContext& context;
  const VSAContainerIdentity& identity;
  bool transient;

  // Steps 3 and 4 of the operation: may the client reach this container?
  VSAErrorRef checkAccess() {
    const auto& client = connection.clientIdentity();
    std::string bundle = client ? client->bundleIdentifier() : std::string();
    VSAContainerClass c = identity.containerClass();
    const std::string& id = identity.identifier();
    bool entitledLookup = connection.isEntitledForLookupWithClass(c, id);
    bool allowed = id == bundle || connection.allowOtherIdLookup() ||
                   ((c == 13 || c == 7) && connection.allowGroupIdLookup()) ||
                   connection.unrestricted() || entitledLookup ||
                   context.whitelist->isLookupWhitelistedFromCodeSignIdentifier(bundle, c, id);
    if (!allowed)
      return failure(VSAResult::kNotEntitled, nullptr,
                     VSAFormat("%@ not entitled to retrieve container class %ld with identifier %@",
                               bundle, static_cast<long>(c), id));
    if (c == 12 && !connection.allowOtherIdLookup() && !connection.unrestricted() &&
        !entitledLookup) {
      bool passes = context.whitelist->isLookupWhitelistedFromCodeSignIdentifier(bundle, 12, id) ||
                    (context.codeSigningMapping->identifierHasSystemContainer(id) && id == bundle);
      if (!passes)
        return failure(
            VSAResult::kNotEntitled, nullptr,
            VSAFormat("%@ not entitled for system container with identifier %@", bundle, id));
    }
    return nullptr;
  }

  std::string liveName(const std::string& uuidName) {
    VSAContainerClass c = identity.containerClass();
    if (c == 12 || c == 13)
      if (auto name = context.whitelist->wellknownContainerForId(identity.identifier(), c))
        return *name;
    return uuidName;
  }

  // Step 8: a new container, assembled in staging and renamed into place.
  VSAMetadataRef create(VSAErrorRef* error) {
    VSAContainerClass c = identity.containerClass();
    const auto& user = identity.userIdentity();
    auto& config = *context.globalConfiguration;
    std::string name = VSAUUID::random().string();
    VSALog(kVSALogInfo, kOrigin, "CreatingContainer uuid=%@ identifier=%@ class=%llu", name,
           identity.identifier(), static_cast<unsigned long long>(c));
    std::string staging = VSAPathJoin(config.stagingDirectoryURLForUserIdentity(user, c), name);
    VSAErrorRef underlying;
    if (!connection._createTopLevelContainerDirectory(
            staging, c, user->posixUIDForContainerClass(c), user->posixGIDForContainerClass(c),
            &underlying)) {
      *error = failure(kStagingCreateFailed, underlying,
                       VSAFormat("Failed to create staging dir at %@ : %@", staging, underlying));
      // The directory may exist although a later step of its creation (its
      // protection class, its owner) failed; its name is fresh, so it is ours.
      discard(staging, error);
      return nullptr;
    }
    // Where the new container is: in staging until it has been renamed into place.
    std::string made = staging;
    VSAMetadataRef metadata = assemble(staging, name, &made, error);
    if (!metadata) discard(made, error);
    return metadata;
  }

  // Nothing of a failed creation stays outside death row. A directory that
  // is not there (its mkdir failed) is no failure.
  void discard(const std::string& directory, VSAErrorRef* error) {
    VSAErrorRef cleanup;
    if (!context.deathRow->_moveItemAtURLToDeathRow(directory, true, true, &cleanup))
      *error = failure(kStagingRemovalFailed, *error,
                       VSAFormat("Failed to remove staging dir: %@", directory));
  }

  VSAMetadataRef assemble(const std::string& staging, const std::string& name, std::string* made,
                          VSAErrorRef* error) {
    VSAContainerClass c = identity.containerClass();
    auto& config = *context.globalConfiguration;
    VSAResultCode code = VSAResult::kSuccess;
    auto concrete = VSAConcreteContainerIdentity::containerIdentityWithUUID(
        VSAUUID::random(), identity.userIdentity(), identity.identifier(), c, &code);
    if (!concrete) {
      *error = failure(code, nullptr, VSAFormat("Failed to make identity for %@", identity));
      return nullptr;
    }
    auto metadata = std::make_shared<VSAMetadata>(concrete, std::nullopt, staging, std::nullopt);
    if (!metadata->writeMetadataToDiskWithError(config, error)) return nullptr;
    if (VSAContainerClassIsSystem(c) &&
        !context.fileManager->setTopLevelSystemContainerACLAtURL(staging, error))
      return nullptr;
    if (!connection._createSubDirectories(staging, *metadata, error)) return nullptr;
    auto base = config.containerDirectoryURLForUserIdentity(identity.userIdentity(), c, transient);
    std::string live = VSAPathJoin(base.value_or(""), liveName(name));
    VSAErrorRef underlying;
    if (!base || !context.fileManager->moveItemAtURL(staging, live, &underlying)) {
      *error = failure(kStagingMoveFailed, underlying,
                       VSAFormat("Failed to move staging dir: %@ to live dir: %@", staging, live));
      return nullptr;
    }
    *made = live;
    if (context.deviceProperties->isFeatureEnabled("fast_container_sizing"))
      context.fileManager->fastDiskUsageForURL(live);
    metadata->setUrl(live);
    metadata->setExisted(false);
    metadata->setTransient(transient);
    if (!context.containerCache->addContainerMetadata(*metadata, live, transient, true,
                                                      &underlying)) {
      *error = failure(kCacheAddFailed, underlying,
                       VSAFormat("Failed to add to cache : %@, url: %@, transient: %d", *metadata,
                                 live, transient));
      // The container is complete on disk but unknown to the cache; the caller
      // sends it to death row from where it is, so that no later creation of
      // the identity finds a twin in the class directory.
      return nullptr;
    }
    return metadata;
  }
};
}  // namespace

VSAMetadataRef VSAClientConnection::createOrLookupContainerWithContainerIdentity(
    const VSAContainerIdentityRef& identity, bool createIfNecessary, bool transient,
    bool useLocking, VSAResultCode* withError) {
  VSALog(kVSALogDebug, kOrigin,
         "createOrLookup; identity: %@, createIfNecessary: %d, transient: %d, allowOtherIdLookup: "
         "%d, unrestricted: %d, clientBundleIdentifier: %@",
         identity ? identity->description() : std::string("(null)"), createIfNecessary, transient,
         allowOtherIdLookup_, unrestricted_,
         clientIdentity_ ? clientIdentity_->bundleIdentifier() : std::string());
  if (!identity) {
    VSALog(kVSALogError, kOrigin, "Cannot lookup a nil container identity.");
    VSASetCode(withError, VSAResult::kOutOfRange);
    return nullptr;
  }
  CreateSteps steps{*this, context_, *identity, transient};
  VSAErrorRef error = steps.checkAccess();
  VSAMetadataRef found;
  GlobalLock lock(useLocking);
  try {
    if (!error && !transient) {
      lock.acquire(false);
      found = context_.containerCache->containerForContainerIdentity(
          *identity, false, true, !(clientIdentity_ && clientIdentity_->isKernel()), &error);
      if (found) found->setExisted(true);
      if (isNotFound(error)) error = nullptr;
      lock.release();
    }
    if (!found && !error && !createIfNecessary)
      error =
          failure(VSAResult::kContainerNotFound, nullptr,
                  VSAFormat("Container with identifier: \"%@\" Not Found", identity->identifier()));
    if (!found && !error) {
      lock.acquire(true);
      found = context_.containerCache->containerForContainerIdentity(
          *identity, transient, true, !(clientIdentity_ && clientIdentity_->isKernel()), &error);
      if (isNotFound(error)) error = nullptr;
      if (found && !transient) {
        found->setExisted(true);
      } else if (!error) {
        // A transient container is always made fresh.
        VSAErrorRef moveError;
        if (found &&
            !context_.deathRow->_moveItemAtURLToDeathRow(found->url(), true, true, &moveError)) {
          error = failure(kTransientRemovalFailed, moveError,
                          VSAFormat("Failed to remove transient container at %@", found->url()));
        } else {
          if (found)
            context_.containerCache->removeContainerForUserIdentity(
                found->userIdentity(), found->containerClass(), found->identifier(), true, nullptr);
          found = steps.create(&error);
        }
      }
    }
  } catch (const std::exception& e) {
    if (context_.globalConfiguration->isInternalImage()) std::terminate();
    error = failure(kException, nullptr,
                    VSAFormat("Got exception: %@ : %@", "std::exception", e.what()));
    found = nullptr;
  }
  if (error) {
    VSASetCode(withError, error->resultCode(kStagingCreateFailed));
    return nullptr;
  }
  return found;
}
