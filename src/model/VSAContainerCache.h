// The container cache: per (user identity, class), and separately for live
// and transient containers, a map from identifier to validated metadata,
// built once from disk and then changed in place by create, delete and
// replace. It keeps the sandbox's per-user container table in step, and a
// single lookup may ask that table before building a whole class map.
//
// One mutex covers both dictionaries and is held for whole class-map builds
// (a class is never built twice; other lookups wait). Found containers are
// checked on disk after the lock is released; a container whose metadata
// vanished is reported once (44) and dropped. Lookups hand out copies.
// The well-known container table and the code-signing records are reached
// through their interfaces, which keeps this module below them; whoever
// fills Dependencies keeps both alive as long as the cache.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/VSATestLocks.h"
#include "model/VSACodeSigningQueries.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAMetadata.h"
#include "model/VSAUserIdentityCache.h"
#include "model/VSAWellknownContainers.h"
#include "platform/VSANotificationCenter.h"
#include "platform/VSASandboxService.h"

// How a cache call treats the containers it finds or adds. Call sites name
// what they set ({.transient = true, .updateSandbox = true}); what is not
// named is off.
struct VSACacheOptions {
  bool transient = false;      // the transient containers' maps, not the live ones
  bool updateSandbox = false;  // keep the sandbox's container table in step
  // Lookups only: a single container may come from the sandbox's table
  // before its whole class map is built.
  bool allowKernelLookup = false;
};

class VSAContainerCache : public VSAUserIdentityCacheObserver,
                          public std::enable_shared_from_this<VSAContainerCache> {
 public:
  struct Dependencies {
    std::shared_ptr<VSAUserIdentityCache> userIdentityCache;
    std::shared_ptr<VSAGlobalConfiguration> configuration;
    std::shared_ptr<VSASandboxService> sandbox;
    std::shared_ptr<VSANotificationCenter> notifications;
    std::shared_ptr<VSATestLocks> testLocks;
    // The parent app of a plug-in. Never null.
    VSACodeSigningQueries* codeSigning = nullptr;
    // Well-known system (12) and system group (13) container identifiers. Never null.
    const VSAWellknownContainers* wellknown = nullptr;
  };

  // Makes the cache and registers it as an observer of the user identity cache.
  static std::shared_ptr<VSAContainerCache> create(Dependencies deps);

  [[nodiscard]] VSAMetadataRef containerForContainerIdentity(const VSAContainerIdentity& identity,
                                                             VSACacheOptions options,
                                                             VSAErrorRef* error);
  [[nodiscard]] VSAMetadataRef containerForContainerIdentity(const VSAContainerIdentity& identity) {
    return containerForContainerIdentity(identity, {}, nullptr);
  }
  // The entries are the maps' own (read-only, never changed once stored):
  // listing a class of 10,000 containers copies no metadata.
  [[nodiscard]] std::optional<std::vector<VSAConstMetadataRef>> allContainersForUserIdentity(
      const VSAUserIdentityRef& user, VSAContainerClass contentClass, VSACacheOptions options,
      VSAErrorRef* error);
  [[nodiscard]] bool addContainerMetadata(const VSAMetadata& metadata, const std::string& url,
                                          VSACacheOptions options, VSAErrorRef* error);
  [[nodiscard]] bool removeContainerForUserIdentity(const VSAUserIdentityRef& user,
                                                    VSAContainerClass contentClass,
                                                    const std::string& identifier, bool transient,
                                                    VSAErrorRef* error);
  void invalidateUserIdentity(const VSAUserIdentityRef& user);
  void userIdentityCacheDidInvalidateUserIdentity(VSAUserIdentityCache& cache,
                                                  const VSAUserIdentityRef& identity) override;

  [[nodiscard]] bool shouldRegisterSandboxMappingWithUserIdentity(const VSAUserIdentityRef& user,
                                                                  const std::string& identifier,
                                                                  VSAContainerClass containerClass);
  [[nodiscard]] bool setSandboxContainerMappingForUserIdentity(
      const VSAUserIdentityRef& user, const std::string& identifier,
      VSAContainerClass containerClass, const std::optional<std::string>& url);

  [[nodiscard]] static bool containerURLIsValidForContainerClass(
      const std::string& url, VSAContainerClass containerClass,
      const VSAWellknownContainers& wellknown);
  static std::string cacheKeyForUserIdentity(const VSAUserIdentityRef& user,
                                             VSAContainerClass containerClass);
  // Whether the class map has been built (tests and diagnostics).
  [[nodiscard]] bool hasClassMap(const VSAUserIdentityRef& user, VSAContainerClass c,
                                 bool transient);
  // How many containers each built class map holds, by cache key (the state dump).
  struct ClassMapSize {
    std::string key;  // "[user]-class" or the class alone
    bool transient;
    size_t containers;
  };
  std::vector<ClassMapSize> classMapSizes();

 private:
  // Identifier -> metadata. Hashed: a sorted tree of 10,000 entries costs a
  // cache miss per level on every insertion while the map is built. The key
  // is a view of the entry's own identifier (no second copy of every
  // identifier): an entry is immutable once stored (a const reference), and
  // only `putEntry` adds one, erasing the entry it replaces with its key.
  using ClassMap = std::unordered_map<std::string_view, VSAConstMetadataRef>;
  static void putEntry(ClassMap& map, VSAConstMetadataRef metadata);
  explicit VSAContainerCache(Dependencies deps) : deps_(std::move(deps)) {}
  // `built` (if given) is set when the map was read from disk by this call.
  // Without `build` only a map that exists is answered.
  ClassMap* _lock_getCache(const VSAUserIdentityRef& user, VSAContainerClass c,
                           VSACacheOptions options, bool build, VSAErrorRef* error,
                           bool* built = nullptr);
  [[nodiscard]] VSAMetadataRef _lock_metadataFromSandbox(const VSAContainerIdentity& identity);
  // The on-disk checks done outside the lock; false (and the entry dropped) when stale.
  [[nodiscard]] bool checkFound(const VSAMetadata& m, const std::string& key, bool transient,
                                VSAErrorRef* error);

  Dependencies deps_;
  std::mutex cacheLock_;
  std::map<std::string, ClassMap> live_;
  std::map<std::string, ClassMap> transient_;
};
