#include "model/VSAUserIdentityCache.h"

#include <thread>

#include "base/VSACrash.h"
#include "base/VSALog.h"
#include "model/VSAUserIdentitySharedCache.h"

namespace {
constexpr const char* kOrigin = "VSAUserIdentityCache";

template <typename... A>
void fault(const char* format, const A&... args) {
  VSALog(kVSALogFault, kOrigin, format, args...);
}
}  // namespace

VSAUserIdentityCache::VSAUserIdentityCache(Dependencies deps, Options options)
    : deps_(std::move(deps)), options_(std::move(options)) {
  if (!options_.terminate) options_.terminate = [](const std::string& m) { VSACrash(m); };
  flush();
  flushQueue_ = VSAWorkQueue::create("com.tamsk.vessad.VSAUserIdentityCache.flushQueue");
}

std::shared_ptr<VSAUserIdentityCache> VSAUserIdentityCache::create(Dependencies deps,
                                                                   Options options) {
  std::shared_ptr<VSAUserIdentityCache> cache(
      new VSAUserIdentityCache(std::move(deps), std::move(options)));
  cache->registerForUpdates();
  return cache;
}

std::shared_ptr<VSAUserIdentitySharedCache> VSAUserIdentitySharedCache::create(Dependencies deps,
                                                                               Options options) {
  std::shared_ptr<VSAUserIdentitySharedCache> cache(
      new VSAUserIdentitySharedCache(std::move(deps), std::move(options)));
  cache->registerForUpdates();
  return cache;
}

VSAUserIdentityCache::~VSAUserIdentityCache() { unregister(); }

bool VSAUserIdentityCache::personasAreSupported(const VSADeviceProperties& device) {
  const VSAValue* flags = device.deviceDictionary().get("MultiUserFlags");
  if (flags && flags->uint64Value() && (*flags->uint64Value() & 0x80000000u)) return false;
  if (device.deviceDictionary().get("PersonasDisabled") &&
      device.deviceDictionary().get("PersonasDisabled")->boolValue().value_or(false))
    return false;
  return !device.usesEphemeralStorage();
}

void VSAUserIdentityCache::registerForUpdates() {
  if (!deps_.personaService) return;
  std::weak_ptr<VSAUserIdentityCache> weak = weak_from_this();
  deps_.personaService->registerObserver(
      "com.tamsk.vessad.personaobserver",
      [weak] {
        if (auto self = weak.lock()) self->personaListDidUpdate();
      },
      [weak](VSAErrorRef error) {
        auto self = weak.lock();
        if (!self) return;
        if (error) {
          fault("Failed to register for persona list updates: %@", error);
          return;
        }
        self->registered_ = true;
        VSALog(kVSALogNotice, kOrigin, "Registered for persona list updates.");
      });
}

VSAUserIdentityRef VSAUserIdentityCache::defaultUserIdentity() {
  std::call_once(defaultOnce_, [this] {
    default_ = VSAUserIdentity::make(
        deps_.mobileUID, deps_.mobileGID, homeDirectoryForUID(deps_.mobileUID), std::nullopt,
        kVSAPersonaTypePersonal, static_cast<int32_t>(deps_.mobileUID));
  });
  return default_;
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityForLegacyMobileUser() {
  std::call_once(legacyOnce_, [this] {
    legacy_ = VSAUserIdentity::make(501, 501, homeDirectoryForUID(501), std::nullopt,
                                    kVSAPersonaTypePersonal, 501);
  });
  return legacy_;
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityWithPersonaAttributes(
    const VSAPersonaAttributes* a, uid_t uid, gid_t gid, bool forceUnspecific) {
  std::optional<std::string> unique = a ? a->uniqueString : std::nullopt;
  int32_t personaID = a ? static_cast<int32_t>(a->personaID) : static_cast<int32_t>(uid);
  std::string home =
      a && a->isEnterprise() && a->layoutPath ? *a->layoutPath : homeDirectoryForUID(uid);
  uint32_t type = forceUnspecific            ? kVSAPersonaTypeUnspecific
                  : (a && a->isPersonal())   ? kVSAPersonaTypePersonal
                  : (a && a->isEnterprise()) ? kVSAPersonaTypeEnterprise
                                             : kVSAPersonaTypeUnspecific;
  return VSAUserIdentity::make(uid, gid, std::move(home), std::move(unique), type, personaID);
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityWithPersonaAttributes(
    const VSAPersonaAttributes* attributes, bool forceUnspecific) {
  return userIdentityWithPersonaAttributes(attributes, deps_.mobileUID, deps_.mobileGID,
                                           forceUnspecific);
}

VSAUserIdentityRef VSAUserIdentityCache::updateUserIdentity(const VSAUserIdentityRef& identity,
                                                            uid_t uid, gid_t gid) {
  if (!identity) return nullptr;
  std::string home =
      identity->isEnterprise() ? identity->homeDirectoryURL() : homeDirectoryForUID(uid);
  return VSAUserIdentity::make(uid, gid, std::move(home), identity->personaUniqueString(),
                               identity->personaType(), identity->kernelPersonaID());
}

void VSAUserIdentityCache::applyUIDFloor(uid_t& uid, gid_t& gid) const {
  if (uid < kVSAMinimumUserUID) {
    uid = deps_.mobileUID;
    gid = deps_.mobileGID;
  }
}

VSAUserIdentityRef VSAUserIdentityCache::rebasedIfNeeded(const VSAUserIdentityRef& identity,
                                                         uid_t uid, gid_t gid) {
  if (!identity || (identity->posixUID() == uid && identity->posixGID() == gid)) return identity;
  return updateUserIdentity(identity, uid, gid);
}

std::shared_ptr<const VSAUserIdentityCache::Snapshot> VSAUserIdentityCache::snapshot() {
  std::lock_guard lock(lock_);
  if (cacheInvalid_) _lock_resync();
  return lock_snapshot_;
}

void VSAUserIdentityCache::_lock_resync() {
  if (!personasAreSupported()) {
    cacheInvalid_ = false;
    return;
  }
  for (int n = 0;; ++n) {
    auto list = deps_.personaService ? deps_.personaService->listPersonas() : std::nullopt;
    std::vector<VSAPersonaAttributes> personas = list ? *list : std::vector<VSAPersonaAttributes>{};
    std::string described;
    for (const auto& p : personas) described += p.description() + " ";
    VSALog(kVSALogNotice, "_lock_resync", "Got userPersonaAttributes: %@ on try: %lu", described,
           static_cast<unsigned long>(n));
    if (!personas.empty() && _lock_resync_fromUserPersonaAttributes(personas)) break;
    if (personas.empty() && n == 0) {
      VSALog(kVSALogError, "_lock_resync", "Did not receive any persona attributes: %@", described);
      fault("Did not receive any persona attributes.");
    }
    if (n + 1 >= options_.maxTries) {
      VSALog(kVSALogError, "_lock_resync",
             "Could not obtain persona attributes after exhausting retries, crashing");
      options_.terminate("Could not obtain persona attributes after exhausting retries.");
      return;  // only reached when `terminate` returns (tests)
    }
    std::this_thread::sleep_for(options_.retryDelay);
  }
  cacheInvalid_ = false;
}

bool VSAUserIdentityCache::_lock_resync_fromUserPersonaAttributes(
    const std::vector<VSAPersonaAttributes>& list) {
  std::string described;
  for (const auto& p : list) described += p.description() + " ";
  const VSAPersonaAttributes* personalRecord = nullptr;
  for (const auto& p : list)
    if (p.isPersonal()) {
      personalRecord = &p;
      break;
    }
  if (!personalRecord) {
    fault("Expected to find a personal persona in %@", described);
    return false;
  }
  if (!personalRecord->uniqueString) {
    fault("Invalid persona unique string for personal %@", *personalRecord);
    return false;
  }
  auto next = std::make_shared<Snapshot>();
  next->personal = userIdentityWithPersonaAttributes(personalRecord, false);
  next->unspecific = userIdentityWithPersonaAttributes(personalRecord, true);
  VSALog(kVSALogNotice, kOrigin, "Found personal persona %@: created personal %@, unspecific %@",
         *personalRecord, next->personal, next->unspecific);
  if (!next->personal || !next->unspecific) {
    fault("Expected to find a personal persona in %@", described);
    return false;
  }
  next->personaUniqueStringToUserIdentity[*personalRecord->uniqueString] = next->personal;
  next->personaIDToUserIdentity[personalRecord->personaID] = next->personal;
  std::set<std::string> sharedApps;
  for (const auto& p : list) {
    VSALog(kVSALogDebug, kOrigin, "Looking at universal=%d system=%d attributes: %@",
           p.isUniversal(), p.isSystem(), p);
    if (!p.isUniversal() && !p.isSystem()) continue;
    std::vector<std::string> ids = p.bundleIdentifiers.value_or(std::vector<std::string>{});
    std::string idList;
    for (const auto& id : ids) idList += id + " ";
    VSALog(kVSALogNotice, kOrigin, "Fetched bundle ID list for universal/system %@: %@", p, idList);
    sharedApps.insert(ids.begin(), ids.end());
    if (p.uniqueString) next->personaUniqueStringToUserIdentity[*p.uniqueString] = next->unspecific;
    next->personaIDToUserIdentity[p.personaID] = next->unspecific;
  }
  for (const auto& p : list) {
    if (!p.isEnterprise()) continue;
    if (!p.uniqueString) {
      fault("Invalid persona unique string for %@", p);
      continue;
    }
    VSAUserIdentityRef e = userIdentityWithPersonaAttributes(&p, false);
    VSALog(kVSALogNotice, kOrigin, "Creating user identity for %@: %@", p, e);
    if (!e) continue;
    next->personaUniqueStringToUserIdentity[*p.uniqueString] = e;
    next->personaIDToUserIdentity[p.personaID] = e;
    std::string idList;
    for (const auto& id : p.bundleIdentifiers.value_or(std::vector<std::string>{})) {
      idList += id + " ";
      next->bundleToEnterpriseIdentities[id].insert(e);
    }
    VSALog(kVSALogNotice, kOrigin, "Fetched bundle ID list for enterprise %@: %@", p, idList);
    for (const auto& app : sharedApps) next->bundleToEnterpriseIdentities[app].insert(e);
  }
  for (const auto& app : sharedApps) next->bundleToEnterpriseIdentities[app].insert(next->personal);
  lock_snapshot_ = std::move(next);
  return true;
}

void VSAUserIdentityCache::_lock_flush() {
  cacheInvalid_ = true;
  auto empty = std::make_shared<Snapshot>();
  empty->personal = defaultUserIdentity();
  empty->unspecific = defaultUserIdentity();
  lock_snapshot_ = std::move(empty);
}

void VSAUserIdentityCache::flush() {
  std::vector<VSAUserIdentityRef> enterprise;
  {
    std::lock_guard lock(lock_);
    if (lock_snapshot_) {
      for (const auto& [s, identity] : lock_snapshot_->personaUniqueStringToUserIdentity)
        if (identity && identity->isEnterprise()) enterprise.push_back(identity);
    }
    _lock_flush();
  }
  std::vector<std::shared_ptr<VSAUserIdentityCacheObserver>> observers;
  {
    std::lock_guard monitor(observersMonitor_);
    for (auto& w : observers_)
      if (auto o = w.lock()) observers.push_back(o);
  }
  for (const auto& identity : enterprise)
    for (const auto& o : observers) o->userIdentityCacheDidInvalidateUserIdentity(*this, identity);
}

void VSAUserIdentityCache::flushAndRepopulateWithUserIdentities(
    const std::vector<VSAUserIdentityRef>& identities) {
  std::lock_guard lock(lock_);
  auto next = std::make_shared<Snapshot>();
  for (const auto& identity : identities) {
    if (!identity) continue;
    if (identity->personaUniqueString())
      next->personaUniqueStringToUserIdentity[*identity->personaUniqueString()] = identity;
    next->personaIDToUserIdentity[static_cast<uint32_t>(identity->kernelPersonaID())] = identity;
    if (!identity->isEnterprise() && !identity->isNoSpecificPersona()) next->personal = identity;
    if (identity->isNoSpecificPersona()) next->unspecific = identity;
  }
  if (!next->unspecific && next->personal) {
    const auto& p = next->personal;
    next->unspecific = VSAUserIdentity::make(p->posixUID(), p->posixGID(), p->homeDirectoryURL(),
                                             p->personaUniqueString(), kVSAPersonaTypeUnspecific,
                                             p->kernelPersonaID());
  }
  lock_snapshot_ = std::move(next);
  cacheInvalid_ = false;
}

void VSAUserIdentityCache::addObserver(const std::shared_ptr<VSAUserIdentityCacheObserver>& o) {
  std::lock_guard monitor(observersMonitor_);
  observers_.push_back(o);
}

void VSAUserIdentityCache::removeObserver(const std::shared_ptr<VSAUserIdentityCacheObserver>& o) {
  std::lock_guard monitor(observersMonitor_);
  std::erase_if(observers_, [&](const auto& w) {
    auto s = w.lock();
    return !s || s == o;
  });
}

void VSAUserIdentityCache::personaListDidUpdate() {
  VSALog(kVSALogNotice, kOrigin, "Persona list update received");
  VSATransactions::Token token = deps_.transactions ? deps_.transactions->open() : nullptr;
  std::weak_ptr<VSAUserIdentityCache> weak = weak_from_this();
  flushQueue_->async([weak, token] {
    if (auto self = weak.lock()) {
      VSALog(kVSALogNotice, kOrigin, "Flushing user identity cache after persona list update");
      self->flush();
    }
  });
}
