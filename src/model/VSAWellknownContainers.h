// What the container model and the operations above it ask of the platform's
// fixed container tables: the well-known system (12) and system group (13)
// containers, and the lookups that are whitelisted without a grant.
// VSAWhitelist answers; declaring the questions here keeps the model and the
// operations below code signing. Implementations are immutable and
// thread-safe; the daemon context owns the one it hands out and keeps it
// alive as long as everything it gave it to.
#pragma once

#include <optional>
#include <string>

#include "model/VSAContainerClass.h"

class VSAWellknownContainers {
 public:
  virtual ~VSAWellknownContainers() = default;

  // The directory name of a well-known system (group) container, or nothing.
  virtual std::optional<std::string> wellknownContainerForId(
      const std::string& id, VSAContainerClass containerClass) const = 0;
  bool containerIdIsWellknown(const std::string& id, VSAContainerClass containerClass) const {
    return wellknownContainerForId(id, containerClass).has_value();
  }
  // May `client` look up container `containerIdentifier` of the class
  // without a grant?
  virtual bool isLookupWhitelistedFromCodeSignIdentifier(
      const std::string& client, VSAContainerClass forContainerClass,
      const std::string& containerIdentifier) const = 0;
};
