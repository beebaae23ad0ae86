// What one client may do in the request being served: its own identifier
// and user identity, and the grants the dispatcher derived for the command.
//
// `entitled` covers the command's operation on the client's own identifiers;
// `allowOtherIdLookup` other identifiers and non-well-known system
// containers; `allowGroupIdLookup` group containers the caller is not
// entitled to (kernel only); `unrestricted` lifts per-identifier limits;
// `lookup` is the lookup entitlement dictionary (class key -> identifiers)
// and `entitledWipeIdentifiers` the identifiers a client may wipe.
// Owned by the request's client connection; operations read it and a few
// (the wipe) widen it for the rest of the request. The parsed lookup lists
// are cached and guarded, so concurrent readers are safe.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "base/VSAValue.h"
#include "model/VSAContainerClass.h"
#include "model/VSAUserIdentity.h"

class VSAOperationGrants {
 public:
  VSAOperationGrants() = default;
  VSAOperationGrants(const VSAOperationGrants&) = delete;
  VSAOperationGrants& operator=(const VSAOperationGrants&) = delete;

  std::string clientIdentifier;           // the client's signing identifier ("" when none)
  VSAUserIdentityRef clientUserIdentity;  // may be null
  bool clientIsKernel = false;
  bool entitled = false;
  bool allowOtherIdLookup = false;
  bool allowGroupIdLookup = false;
  bool unrestricted = false;
  std::optional<VSAValue> lookup;
  std::optional<VSAValue> entitledWipeIdentifiers;

  // The identifiers the lookup entitlement lists for a class (nothing when
  // the client has none, or for a class outside 1-13).
  [[nodiscard]] std::optional<std::set<std::string>> lookupForContainerClass(
      VSAContainerClass c) const;
  [[nodiscard]] bool isEntitledForLookupWithClass(VSAContainerClass c,
                                                  const std::string& identifier) const;
  // Whether `identifier` is listed (plainly, as a string) in the wipe list.
  [[nodiscard]] bool isEntitledToWipe(const std::string& identifier) const;

 private:
  mutable std::mutex lookupCacheMutex_;
  mutable std::optional<std::map<std::string, std::set<std::string>>> lookupCache_;
};
