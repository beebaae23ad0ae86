// Well-known system containers and whitelisted lookups.
//
// Fixed tables: the system and system-group containers that belong to the
// platform's own services (always allowed to exist), identifiers any client
// may look up in a given class, and clients that may look up containers
// their entitlements would not allow (all of them, all of a class, or listed
// ones). The built-in tables name this platform's services; an integrator
// supplies its own in `<root>/etc/vessad/whitelist.plist`:
//   SystemContainers: [id...]           SystemGroupContainers: [id...]
//   InternalSystemGroupContainers: [id...] (added on internal builds)
//   ClassLookup: {"10": [id...]}        Clients: {client: "*" | {"7": "*" | [id...]}}
// Immutable after construction; thread-safe.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "base/VSAValue.h"
#include "model/VSAContainerClass.h"
#include "model/VSAWellknownContainers.h"

class VSAWhitelist : public VSAWellknownContainers {
 public:
  // "Any" in the client tables.
  static constexpr const char* kAnyMarker = "*";

  // initWithSystemContainerMapping:systemGroupContainerMapping:
  //   whitelistedContainerMapping:whitelistedCodeSignIdentifierMapping:
  // `whitelistedContainers` maps class numbers (as strings) to arrays;
  // `clients` maps client identifiers to "*" or to class -> "*" / array.
  VSAWhitelist(const VSAValue& systemContainers, const VSAValue& systemGroupContainers,
               const VSAValue& whitelistedContainers, const VSAValue& clients);

  // The built-in tables, or those of `configPath` when that file exists.
  static std::shared_ptr<VSAWhitelist> load(const std::string& configPath, bool internalBuild);
  static VSAValue builtInTables();

  bool isLookupWhitelistedFromCodeSignIdentifier(
      const std::string& client, VSAContainerClass forContainerClass,
      const std::string& containerIdentifier) const override;
  const std::set<std::string>& wellknownSystemContainers() const { return system_; }
  const std::set<std::string>& wellknownSystemGroupContainers() const { return systemGroups_; }
  bool systemContainerIdIsWellknown(const std::string& id) const { return system_.count(id) > 0; }
  bool systemGroupContainerIdIsWellknown(const std::string& id) const {
    return systemGroups_.count(id) > 0;
  }
  std::optional<std::string> wellknownContainerForId(
      const std::string& id, VSAContainerClass containerClass) const override;

 private:
  // nullopt = any identifier.
  using IdentifierSet = std::optional<std::set<std::string>>;
  std::set<std::string> system_;
  std::set<std::string> systemGroups_;
  std::map<VSAContainerClass, std::set<std::string>> perClass_;
  // client -> (nullopt = any class) class -> identifiers
  std::map<std::string, std::optional<std::map<VSAContainerClass, IdentifierSet>>> clients_;
};
