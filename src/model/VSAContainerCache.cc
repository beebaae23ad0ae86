#include "model/VSAContainerCache.h"

#include <iterator>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSATestLocks.h"
#include "platform/VSAFileManager.h"

namespace {
constexpr const char* kOrigin = "VSAContainerCache";

const char* shortName(VSAContainerClass c) {
  static const char* names[] = {"undefined", "app",     "appData",    "plugin",     "pluginData",
                                "vpn",       "vpnData", "appGroup",   "framework",  "relayService",
                                "daemon",    "tempDir", "systemData", "systemGroup"};
  return c < std::size(names) ? names[c] : "invalid";
}

const char* transientTag(bool transient) { return transient ? "(transient)" : ""; }

template <typename... A>
VSAErrorRef cacheError(VSAResultCode code, const char* format, const A&... args) {
  auto e = VSAError::make(code, nullptr, kOrigin, __LINE__, format, args...);
  VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin, "%@", e->message());
  return e;
}

VSAErrorRef rebuildError(const VSAUserIdentityRef& user, VSAContainerClass c, bool transient) {
  return cacheError(VSAResult::kCacheRebuildFailed, "Cache: [%@]-%@%@: Failed to rebuild",
                    user ? user->identifier() : std::string(), shortName(c),
                    transientTag(transient));
}

}  // namespace

std::shared_ptr<VSAContainerCache> VSAContainerCache::create(Dependencies deps) {
  std::shared_ptr<VSAContainerCache> cache(new VSAContainerCache(std::move(deps)));
  cache->deps_.userIdentityCache->addObserver(cache);
  return cache;
}

std::string VSAContainerCache::cacheKeyForUserIdentity(const VSAUserIdentityRef& user,
                                                       VSAContainerClass c) {
  if (!VSAUserIdentity::isUserIdentityRequiredForContainerClass(c)) return shortName(c);
  // "[user]-class", built by hand: every look-up makes one.
  std::string key = "[";
  key += user ? user->identifier() : std::string("(null)");
  key += "]-";
  key += shortName(c);
  return key;
}

bool VSAContainerCache::containerURLIsValidForContainerClass(
    const std::string& url, VSAContainerClass c, const VSAWellknownContainers& wellknown) {
  std::string_view name = VSALastPathComponentView(url);
  if (VSAUUID::parse(name)) return true;
  return VSAContainerClassIsSystem(c) && wellknown.containerIdIsWellknown(std::string(name), c);
}

bool VSAContainerCache::hasClassMap(const VSAUserIdentityRef& user, VSAContainerClass c,
                                    bool transient) {
  std::lock_guard lock(cacheLock_);
  return (transient ? transient_ : live_).count(cacheKeyForUserIdentity(user, c)) > 0;
}

std::vector<VSAContainerCache::ClassMapSize> VSAContainerCache::classMapSizes() {
  std::lock_guard lock(cacheLock_);
  std::vector<ClassMapSize> sizes;
  for (bool transient : {false, true})
    for (const auto& [key, map] : transient ? transient_ : live_)
      sizes.push_back({key, transient, map.size()});
  return sizes;
}

void VSAContainerCache::putEntry(ClassMap& map, VSAConstMetadataRef metadata) {
  const std::string_view key = metadata->identifier();  // lives as long as `metadata`
  auto [it, inserted] = map.try_emplace(key, std::move(metadata));
  if (inserted) return;
  // The old key views the old entry's identifier: both go together.
  map.erase(it);
  map.emplace(key, std::move(metadata));
}

VSAContainerCache::ClassMap* VSAContainerCache::_lock_getCache(const VSAUserIdentityRef& user,
                                                               VSAContainerClass c,
                                                               VSACacheOptions options, bool build,
                                                               VSAErrorRef* error, bool* built) {
  const bool transient = options.transient, populateSandbox = options.updateSandbox;
  std::string key = cacheKeyForUserIdentity(user, c);
  auto& maps = transient ? transient_ : live_;
  if (auto it = maps.find(key); it != maps.end()) return &it->second;
  if (!build) return nullptr;
  VSALogIn(VSALogCategory::Cache, kVSALogNotice, kOrigin, "Rebuilding container class cache: %@%@",
           key, transientTag(transient));
  VSASignpostInterval interval(VSALogCategory::Cache, "RebuildingCache");
  deps_.testLocks->waitOnLock(kVSATestLockCacheRebuild);
  auto& config = *deps_.configuration;
  auto dir = config.containerDirectoryURLForUserIdentity(user, c, transient);
  if (!dir) {
    VSASetError(error, cacheError(VSAResult::kCacheRebuildFailed,
                                  "Cache: %@%@: no directory for class %llu", key,
                                  transientTag(transient), c));
    return nullptr;
  }
  // Listed and read through one descriptor of the class directory.
  VSAUniqueFd classDir;
  auto items = config.fileManager().urlsForItemsInDirectoryAtURL(*dir, &classDir, error);
  if (!items) return nullptr;
  ClassMap map;
  map.reserve(items->size());
  for (auto& item : *items) {
    if (!containerURLIsValidForContainerClass(item.path, c, *deps_.wellknown)) continue;
    VSAErrorRef readError;
    // The path moves into the metadata (the error names the file if it fails).
    auto m = VSAMetadata::readAndValidateMetadataOfEntry(classDir.get(), std::move(item.path), user,
                                                         true, config, *deps_.userIdentityCache,
                                                         &readError);
    // A map without a container that is there would let the next creation
    // make it a second time: a read the system failed fails the rebuild.
    if (!m && VSAMetadata::isTransientReadFailure(readError)) {
      VSASetError(error,
                  cacheError(VSAResult::kCacheRebuildFailed, "Cache: %@%@: could not read: %@", key,
                             transientTag(transient), readError));
      return nullptr;
    }
    if (!m) continue;
    m->setTransient(transient);
    if (populateSandbox && !transient &&
        shouldRegisterSandboxMappingWithUserIdentity(user, m->identifier(), c) &&
        !setSandboxContainerMappingForUserIdentity(user, m->identifier(), c, m->url()))
      VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
               "Failed to set container mapping during create/lookup operation of %@, %llu",
               m->identifier(), c);
    putEntry(map, std::move(m));
  }
  if (built) *built = true;
  return &maps.insert_or_assign(key, std::move(map)).first->second;
}

VSAMetadataRef VSAContainerCache::_lock_metadataFromSandbox(const VSAContainerIdentity& identity) {
  const auto& user = identity.userIdentity();
  VSASignpostInterval interval(VSALogCategory::Cache, "ReadFromSandbox");
  auto item =
      deps_.sandbox->userStateItem(identity.posixUID(), identity.identifier(),
                                   identity.containerClass(), user ? user->kernelPersonaID() : 0);
  if (!item) return nullptr;
  if (item->path.empty()) {
    VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
             "Sandbox item of type %llu has no identifier or path", item->itemType);
    return nullptr;
  }
  VSAErrorRef error;
  auto m = VSAMetadata::readAndValidateMetadataAtUrl(item->path, user, true, *deps_.configuration,
                                                     *deps_.userIdentityCache, &error);
  if (!m) {
    VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
             "Could not validate container from Sandbox-provided path [%@]; error = %@", item->path,
             error);
    return nullptr;
  }
  if (m->containerClass() != identity.containerClass() ||
      m->identifier() != identity.identifier()) {
    VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
             "Attempted to fetch container from Sandbox-provided path [%@] that was not what was "
             "expected; expected class: %llu, expected identifier: [%@], actual class: %llu, "
             "actual identifier: [%@]",
             item->path, identity.containerClass(), identity.identifier(), m->containerClass(),
             m->identifier());
    return nullptr;
  }
  VSALogIn(VSALogCategory::Cache, kVSALogDebug, kOrigin,
           "Took %@ from the sandbox's container table", m->identifier());
  return m;
}

bool VSAContainerCache::checkFound(const VSAMetadata& m, const std::string& key, bool transient,
                                   VSAErrorRef* error) {
  if (m.url().empty()) {
    VSASetError(error, cacheError(VSAResult::kCacheEntryWithoutURL, "Cache: %@%@: nil URL from %@",
                                  key, transientTag(transient), m));
    return false;
  }
  std::string metadataFile = VSAPathJoin(m.url(), kVSAMetadataFileName);
  VSAFileManager& fm = deps_.configuration->fileManager();
  if (fm.itemExistsAtURL(metadataFile)) return true;
  if (!fm.itemDoesNotExistAtURL(metadataFile)) {
    // The disk could not say (an I/O error): dropping the entry would let the
    // next creation make a second container, so it stays and this look-up fails.
    VSASetError(error, cacheError(VSAResult::kCacheInconsistent,
                                  "Cache: %@%@: cannot check the metadata at: %@ for id: %@", key,
                                  transientTag(transient), m.url(), m.identifier()));
    return false;
  }
  {
    VSASetError(
        error,
        cacheError(VSAResult::kCacheInconsistent,
                   "Cache: %@%@: INCONSISTENT-No Metadata at: %@ for id: %@, class: %llu", key,
                   transientTag(transient), m.url(), m.identifier(), m.containerClass()));
    VSAErrorRef removeError;
    if (!removeContainerForUserIdentity(m.userIdentity(), m.containerClass(), m.identifier(),
                                        transient, &removeError))
      VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
               "Failed to remove from cache user: %@, id: %@, class: %llu, transient: %d : %@",
               m.userIdentity(), m.identifier(), m.containerClass(), transient, removeError);
    return false;
  }
  return true;
}

VSAMetadataRef VSAContainerCache::containerForContainerIdentity(
    const VSAContainerIdentity& identity, VSACacheOptions options, VSAErrorRef* error) {
  const bool transient = options.transient, allowKernelLookup = options.allowKernelLookup;
  const auto& user = identity.userIdentity();
  VSAContainerClass c = identity.containerClass();
  std::string key = cacheKeyForUserIdentity(user, c);
  VSAMetadataRef fromSandbox;  // a fresh object of this call, shared with no map
  VSAConstMetadataRef found;
  bool built = false;  // read from disk by this very call: no need to look again
  {
    std::lock_guard lock(cacheLock_);
    ClassMap* map = _lock_getCache(user, c, options, false, nullptr);
    if (!map && allowKernelLookup && !transient) {
      found = fromSandbox = _lock_metadataFromSandbox(identity);
      built = found != nullptr;
    }
    if (!found) {
      if (!map) map = _lock_getCache(user, c, options, true, nullptr, &built);
      if (!map) {
        VSASetError(error, rebuildError(user, c, transient));
        return nullptr;
      }
      auto it = map->find(identity.identifier());
      if (it == map->end()) {
        auto e = VSAError::make(VSAResult::kContainerNotFound, nullptr, kOrigin, __LINE__,
                                "Cache: %@%@: Container Not Found with ID: %@", key,
                                transientTag(transient), identity.identifier());
        VSALogIn(VSALogCategory::Cache, kVSALogDebug, kOrigin, "%@", e->message());
        VSASetError(error, e);
        return nullptr;
      }
      found = it->second;
    }
  }
  // The caller may change what it gets; the map's entry stays as stored.
  VSAMetadataRef copy = fromSandbox ? fromSandbox : std::make_shared<VSAMetadata>(*found);
  if (!built && !checkFound(*copy, key, transient, error)) return nullptr;
  VSALogIn(VSALogCategory::Cache, kVSALogDebug, kOrigin, "Cache: %@%@: Found Identifier: %@", key,
           transientTag(transient), identity.identifier());
  return copy;
}

std::optional<std::vector<VSAConstMetadataRef>> VSAContainerCache::allContainersForUserIdentity(
    const VSAUserIdentityRef& user, VSAContainerClass c, VSACacheOptions options,
    VSAErrorRef* error) {
  const bool transient = options.transient;
  if (!VSAContainerClassIsValid(c)) {
    VSASetError(error, cacheError(VSAResult::kInvalidArgument, "Invalid Content Class: %ld",
                                  static_cast<long>(c)));
    return std::nullopt;
  }
  std::vector<VSAConstMetadataRef> entries;
  std::string key = cacheKeyForUserIdentity(user, c);
  bool built = false;  // every entry was read from disk by this very call
  {
    std::lock_guard lock(cacheLock_);
    ClassMap* map = _lock_getCache(user, c, options, true, error, &built);
    if (!map) return std::nullopt;
    entries.reserve(map->size());
    for (const auto& [id, m] : *map) entries.push_back(m);
  }
  // What this call read from disk is known to be there.
  if (built) return entries;
  std::vector<VSAConstMetadataRef> out;
  out.reserve(entries.size());
  for (auto& m : entries) {
    if (!checkFound(*m, key, transient, nullptr)) continue;
    VSALogIn(VSALogCategory::Cache, kVSALogDebug, kOrigin, "Cache: %@%@: ALL Found Identifier: %@",
             key, transientTag(transient), m->identifier());
    out.push_back(std::move(m));
  }
  return out;
}

bool VSAContainerCache::addContainerMetadata(const VSAMetadata& metadata, const std::string& url,
                                             VSACacheOptions options, VSAErrorRef* error) {
  const bool transient = options.transient, updateSandbox = options.updateSandbox;
  if (url.empty()) {
    VSASetError(error, cacheError(VSAResult::kInvalidArgument, "Invalid input: URL: %@", url));
    return false;
  }
  VSAContainerClass c = metadata.containerClass();
  if (!VSAContainerClassIsValid(c)) {
    VSASetError(error,
                cacheError(VSAResult::kInvalidArgument, "Invalid Metadata Content Class: %lld",
                           static_cast<long long>(c)));
    return false;
  }
  const auto& user = metadata.userIdentity();
  std::lock_guard lock(cacheLock_);
  ClassMap* map = _lock_getCache(user, c, {.transient = transient}, true, nullptr);
  if (!map) {
    VSASetError(error, rebuildError(user, c, transient));
    return false;
  }
  auto filled = std::make_shared<VSAMetadata>(metadata);
  filled->setUrl(url);
  filled->setTransient(transient);
  const VSAConstMetadataRef stored = std::move(filled);  // immutable from here: the map keys it
  putEntry(*map, stored);
  VSALogIn(VSALogCategory::Cache, kVSALogNotice, kOrigin, "Cache: %@%@: Added Identifier: %@",
           cacheKeyForUserIdentity(user, c), transientTag(transient), stored->identifier());
  if (updateSandbox && !transient &&
      shouldRegisterSandboxMappingWithUserIdentity(user, stored->identifier(), c) &&
      !setSandboxContainerMappingForUserIdentity(user, stored->identifier(), c, url))
    VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
             "Failed to set container mapping of %@, %llu", stored->identifier(), c);
  return true;
}

bool VSAContainerCache::removeContainerForUserIdentity(const VSAUserIdentityRef& user,
                                                       VSAContainerClass c,
                                                       const std::string& identifier,
                                                       bool transient, VSAErrorRef* error) {
  if (!VSAContainerClassIsValid(c)) {
    VSASetError(error, cacheError(VSAResult::kInvalidArgument, "Invalid Content Class: %ld",
                                  static_cast<long>(c)));
    return false;
  }
  std::lock_guard lock(cacheLock_);
  ClassMap* map = _lock_getCache(user, c, {.transient = transient}, true, nullptr);
  if (!map) {
    VSASetError(error, rebuildError(user, c, transient));
    return false;
  }
  map->erase(identifier);
  VSALogIn(VSALogCategory::Cache, kVSALogNotice, kOrigin, "Cache: %@%@: Removed Identifier: %@",
           cacheKeyForUserIdentity(user, c), transientTag(transient), identifier);
  if (!transient && VSASandboxItemTypeForClass(c) &&
      !setSandboxContainerMappingForUserIdentity(user, identifier, c, std::nullopt))
    VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
             "Failed to remove container mapping of %@, %llu", identifier, c);
  return true;
}

void VSAContainerCache::invalidateUserIdentity(const VSAUserIdentityRef& user) {
  {
    std::lock_guard lock(cacheLock_);
    for (VSAContainerClass c = kVSAContainerClassMin; c <= kVSAContainerClassMax; ++c) {
      std::string key = cacheKeyForUserIdentity(user, c);
      if (auto it = live_.find(key); it != live_.end()) {
        for (const auto& [id, m] : it->second)
          if (VSASandboxItemTypeForClass(c) &&
              !setSandboxContainerMappingForUserIdentity(user, m->identifier(), c, std::nullopt))
            VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
                     "Failed to remove container mapping of [%@], class: %llu", id, c);
      }
      live_.erase(key);
      transient_.erase(key);
    }
  }
  if (uint32_t status = deps_.notifications->post(CONTAINER_NOTIFY_USER_INVALIDATED))
    VSALogIn(VSALogCategory::Cache, kVSALogError, kOrigin,
             "Could not post user-invalidated notification: %u", status);
}

void VSAContainerCache::userIdentityCacheDidInvalidateUserIdentity(
    VSAUserIdentityCache&, const VSAUserIdentityRef& identity) {
  invalidateUserIdentity(identity);
}

bool VSAContainerCache::shouldRegisterSandboxMappingWithUserIdentity(const VSAUserIdentityRef& user,
                                                                     const std::string& identifier,
                                                                     VSAContainerClass c) {
  bool decision, multi = false;
  std::string app = identifier;
  using namespace VSAClass;
  if (c == kDataApplication || c == kDataPlugin || c == kDataVPNPlugin || c == kDataRelayService ||
      c == kDataInternalDaemon || c == kDataTempDir) {
    if (c == kDataPlugin || c == kDataVPNPlugin)
      if (auto parent = deps_.codeSigning->parentIdentifierForChildIdentifier(identifier))
        app = *parent;
    auto set = deps_.userIdentityCache->userIdentitiesForBundleIdentifier(app);
    auto personal = deps_.userIdentityCache->userIdentityForPersonalPersona();
    multi = set.size() >= 2 && set.count(personal) > 0;
    decision = multi ? !(user && user->isEnterprise()) : set.count(user) > 0;
  } else if (c == kAppGroup) {
    decision = true;
  } else {
    decision = !(user && user->isEnterprise());
  }
  VSALogIn(VSALogCategory::Sandbox, kVSALogDebug, kOrigin,
           "Deciding to register userIdentity: %@, identifier: %@ (%@), containerClass: %llu with "
           "sandbox: %d because isMulti: %d",
           user, identifier, app, c, decision, multi);
  return decision;
}

bool VSAContainerCache::setSandboxContainerMappingForUserIdentity(
    const VSAUserIdentityRef& user, const std::string& identifier, VSAContainerClass c,
    const std::optional<std::string>& url) {
  auto itemType = VSASandboxItemTypeForClass(c);
  if (!itemType) {
    VSALogIn(VSALogCategory::Sandbox, kVSALogError, kOrigin,
             "Unsupported class for setting sandbox container mapping: %llu", c);
    return false;
  }
  uid_t uid = user ? user->posixUIDForContainerClass(c) : 0;
  int32_t persona = user ? user->kernelPersonaID() : 0;
  int rc = deps_.sandbox->setUserStateItem(uid, *itemType, identifier, c, persona, url);
  std::string path = url.value_or("(null)");
  if (rc != 0) {
    VSALogIn(VSALogCategory::Sandbox, kVSALogError, kOrigin,
             url ? "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: "
                   "%llu, path: %s : %d"
                 : "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: "
                   "%llu, path: %s : %d",
             uid, *itemType, identifier, c, path, rc);
    return false;
  }
  VSALogIn(VSALogCategory::Sandbox, kVSALogDebug, kOrigin,
           "Pushed user: %u, itemType: %llu, identifier %s, class: %llu, persona id: %d, path: %s",
           uid, *itemType, identifier, c, persona, path);
  return true;
}
