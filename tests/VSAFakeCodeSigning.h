// Stand-ins for the modules above the container model, for tests that build
// a cache, a stage-for-delete environment or a data-protection manager
// without a code-signing database: each implements one of the interfaces
// through which the lower layers reach code signing and the whitelist.
#pragma once

#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "model/VSACodeSigningQueries.h"
#include "model/VSAWellknownContainers.h"
#include "operations/VSACodeSigningChanges.h"

// Code-signing records kept in a map: an identifier's entitlements, and
// plug-ins' parents.
class VSAFakeCodeSigningQueries : public VSACodeSigningQueries {
 public:
  std::map<std::string, VSAValue> entitlements;
  std::map<std::string, std::string> parents;

  std::optional<VSAValue> entitlementsForIdentifier(const std::string& identifier) override {
    auto it = entitlements.find(identifier);
    if (it == entitlements.end()) return std::nullopt;
    return it->second;
  }
  bool identifierHasSystemContainer(const std::string&) override { return false; }
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& child) override {
    auto it = parents.find(child);
    if (it == parents.end()) return std::nullopt;
    return it->second;
  }
};

// The well-known containers listed in `known` (named by their identifiers),
// and no whitelisted lookups.
class VSAFakeWellknownContainers : public VSAWellknownContainers {
 public:
  std::set<std::pair<std::string, VSAContainerClass>> known;

  std::optional<std::string> wellknownContainerForId(const std::string& id,
                                                     VSAContainerClass c) const override {
    if (known.count({id, c}) == 0) return std::nullopt;
    return id;
  }
  bool isLookupWhitelistedFromCodeSignIdentifier(const std::string&, VSAContainerClass,
                                                 const std::string&) const override {
    return false;
  }
};

// Records the identifiers whose records a staged bundle takes along, and
// runs `onRemove` (when set) at that moment.
class VSARecordingCodeSigningChanges : public VSACodeSigningChanges {
 public:
  std::vector<std::string> removed;
  std::function<void(const std::string&, VSACommandQueue*)> onRemove;

  bool invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string&,
                                                            VSAErrorRef*) override {
    return true;
  }
  void removeCodeSigningDictionariesForIdentifierAndItsChildren(
      const std::string& identifier, VSACommandQueue* commandQueue) override {
    removed.push_back(identifier);
    if (onRemove) onRemove(identifier, commandQueue);
  }
  bool removeAllAdvanceCopiesWithError(VSAErrorRef*) override { return true; }
};
