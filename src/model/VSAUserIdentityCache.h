// The device's current set of user identities, rebuilt from the persona
// service whenever its persona list changes.
//
// Keyed three ways (persona unique string, persona id, bundle identifier ->
// identities allowed to run that app) plus the personal and unspecific
// identities. Maps are replaced whole on each rebuild; readers get the
// snapshot current when they asked. All public methods take `lock_`
// themselves; `_lock_` methods require it. A rebuild retries an empty or
// unusable persona list (61 tries, a second apart by default) with the lock
// held, then ends the process: no container work can go on without
// identities. Observers are held weakly and called with the lock released.
// Create with create(); the object registers for persona-list updates.
#pragma once

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <unordered_set>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"
#include "model/VSAUserIdentity.h"
#include "platform/VSADeviceProperties.h"
#include "platform/VSAPersonaService.h"
#include "platform/VSATransactions.h"
#include "platform/VSAUserDatabase.h"

class VSAUserIdentityCache;

class VSAUserIdentityCacheObserver {
 public:
  virtual ~VSAUserIdentityCacheObserver() = default;
  virtual void userIdentityCacheDidInvalidateUserIdentity(VSAUserIdentityCache& cache,
                                                          const VSAUserIdentityRef& identity) = 0;
};

using VSAUserIdentitySet =
    std::unordered_set<VSAUserIdentityRef, VSAUserIdentityHash, VSAUserIdentityEq>;

class VSAUserIdentityCache : public std::enable_shared_from_this<VSAUserIdentityCache> {
 public:
  struct Options {
    std::chrono::milliseconds retryDelay{1000};
    int maxTries = 61;
    // Ends the process; tests replace it to observe the give-up.
    std::function<void(const std::string&)> terminate;
  };
  struct Dependencies {
    std::shared_ptr<VSAPersonaService> personaService;
    std::shared_ptr<VSAUserDatabase> userDatabase;
    uid_t mobileUID = 501;
    gid_t mobileGID = 501;
    bool personasSupported = true;
    std::shared_ptr<VSATransactions> transactions;  // may be null
  };

  static std::shared_ptr<VSAUserIdentityCache> create(Dependencies deps, Options options);
  static std::shared_ptr<VSAUserIdentityCache> create(Dependencies deps) {
    return create(std::move(deps), Options());
  }
  virtual ~VSAUserIdentityCache();

  // Whether the device uses personas: not with the multi-user top flag bit,
  // not when the personas-disabled device property is set, not on ephemeral
  // storage.
  static bool personasAreSupported(const VSADeviceProperties& device);
  bool personasAreSupported() const { return deps_.personasSupported; }

  VSAUserIdentityRef defaultUserIdentity();
  VSAUserIdentityRef userIdentityForLegacyMobileUser();
  VSAUserIdentityRef userIdentityWithPersonaID(uint32_t personaID);
  VSAUserIdentityRef userIdentityForPersonalPersona();
  VSAUserIdentityRef userIdentityForPersonalPersonaWithUID(uid_t uid, gid_t gid);
  VSAUserIdentityRef unspecificUserIdentity();
  VSAUserIdentityRef userIdentityForPersonaUniqueString(const std::optional<std::string>& unique,
                                                        uid_t uid, gid_t gid);
  VSAUserIdentityRef userIdentityForCurrentUserWithPersonaUniqueString(
      const std::optional<std::string>& unique);
  VSAUserIdentityRef userIdentityForCurrentContextWithUID(uid_t uid, gid_t gid);
  VSAUserIdentityRef userIdentityForCurrentContext();
  bool isBundleIdentifierAssociatedWithUserIdentity(const std::string& bundleIdentifier,
                                                    const VSAUserIdentityRef& identity);
  VSAUserIdentitySet userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier);
  void forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      const std::function<void(const VSAUserIdentityRef&)>& block);

  void flush();
  void flushAndRepopulateWithUserIdentities(const std::vector<VSAUserIdentityRef>& identities);
  void addObserver(const std::shared_ptr<VSAUserIdentityCacheObserver>& observer);
  void removeObserver(const std::shared_ptr<VSAUserIdentityCacheObserver>& observer);
  void personaListDidUpdate();
  void unregister() { registered_ = false; }
  bool registered() const { return registered_; }

  // Identities from persona records.
  VSAUserIdentityRef userIdentityWithPersonaAttributes(const VSAPersonaAttributes* attributes,
                                                       uid_t uid, gid_t gid, bool forceUnspecific);
  VSAUserIdentityRef userIdentityWithPersonaAttributes(const VSAPersonaAttributes* attributes,
                                                       bool forceUnspecific = false);
  // _updateUserIdentity:withUID:GID: a re-based copy.
  VSAUserIdentityRef updateUserIdentity(const VSAUserIdentityRef& identity, uid_t uid, gid_t gid);
  std::string homeDirectoryForUID(uid_t uid) const {
    return deps_.userDatabase->homeDirectoryForUID(uid);
  }
  std::string description() const { return "<VSAUserIdentityCache>"; }

 protected:
  VSAUserIdentityCache(Dependencies deps, Options options);
  void registerForUpdates();

 private:
  struct Snapshot {
    std::map<std::string, VSAUserIdentitySet> bundleToEnterpriseIdentities;
    std::map<std::string, VSAUserIdentityRef> personaUniqueStringToUserIdentity;
    std::map<uint32_t, VSAUserIdentityRef> personaIDToUserIdentity;
    VSAUserIdentityRef personal;
    VSAUserIdentityRef unspecific;
  };
  std::shared_ptr<const Snapshot> snapshot();  // resyncs when invalid
  void _lock_resync();
  bool _lock_resync_fromUserPersonaAttributes(const std::vector<VSAPersonaAttributes>& list);
  void _lock_flush();
  void applyUIDFloor(uid_t& uid, gid_t& gid) const;
  // The identity of a unique string as stored (personal when personas are
  // unsupported, unspecific for no string, nothing for an unknown one).
  VSAUserIdentityRef lookUpPersonaUniqueString(const std::optional<std::string>& unique);
  VSAUserIdentityRef rebasedIfNeeded(const VSAUserIdentityRef& identity, uid_t uid, gid_t gid);

  Dependencies deps_;
  Options options_;
  std::mutex lock_;
  bool cacheInvalid_ = true;
  std::shared_ptr<const Snapshot> lock_snapshot_;
  VSAWorkQueue::Ref flushQueue_;
  std::atomic<bool> registered_{false};
  std::once_flag defaultOnce_, legacyOnce_;
  VSAUserIdentityRef default_, legacy_;
  std::recursive_mutex observersMonitor_;
  std::vector<std::weak_ptr<VSAUserIdentityCacheObserver>> observers_;
};
