#include "operations/VSAGroupContainerLookup.h"

#include <algorithm>

#include "base/VSALog.h"
#include "operations/VSAContainerLookup.h"

namespace {
const char* const kOrigin = "groupContainersForOwnerIdentifier";
}

std::optional<std::vector<std::string>>
VSAGroupContainerLookup::groupContainerIdentifiersForOwnerIdentifier(const std::string& owner,
                                                                     VSAContainerClass groupClass,
                                                                     VSAResultCode* withError) {
  if (!VSAContainerClassIsGroup(groupClass)) {
    VSALog(kVSALogError, kOrigin, "Not a group container class: %llu",
           static_cast<unsigned long long>(groupClass));
    VSASetCode(withError, VSAResult::kInvalidArgument);
    return std::nullopt;
  }
  bool mayAskForOwner =
      owner == grants_.clientIdentifier || grants_.allowOtherIdLookup || grants_.unrestricted;
  auto listed = grants_.lookupForContainerClass(groupClass);
  if (!mayAskForOwner && !listed) {
    VSALog(kVSALogError, kOrigin, "%@ not entitled to look up the group containers of %@",
           grants_.clientIdentifier, owner);
    VSASetCode(withError, VSAResult::kNotEntitled);
    return std::nullopt;
  }
  VSAValue ownerValue(owner);
  auto ids = services_.groups.groupContainerIdentifiersForOwnerIdentifier(&ownerValue, groupClass,
                                                                          true, withError);
  if (!ids) return std::nullopt;
  if (!mayAskForOwner)
    std::erase_if(*ids, [&](const std::string& id) { return listed->count(id) == 0; });
  return ids;
}

std::optional<VSAGroupContainerLookup::Groups>
VSAGroupContainerLookup::groupContainersForOwnerIdentifier(const std::string& owner,
                                                           const VSAUserIdentityRef& userIdentity,
                                                           VSAContainerClass groupClass,
                                                           VSAResultCode* withError) {
  auto ids = groupContainerIdentifiersForOwnerIdentifier(owner, groupClass, withError);
  if (!ids) return std::nullopt;
  // The owner's entitlement to each group is the access grant here.
  bool wasAllowed = grants_.allowGroupIdLookup;
  grants_.allowGroupIdLookup = true;
  Groups groups;
  VSAContainerLookup lookup(services_, grants_);
  for (const auto& id : *ids) {
    VSAResultCode code = VSAResult::kSuccess;
    auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(userIdentity, id,
                                                                            groupClass, &code);
    VSAMetadataRef m = identity ? lookup.createOrLookupContainerWithContainerIdentity(
                                      identity, {.createIfNecessary = true}, &code)
                                : nullptr;
    if (!m) {
      VSALog(kVSALogError, kOrigin, "Failed to look up group container %@ of %@: %llu", id, owner,
             static_cast<unsigned long long>(code));
      grants_.allowGroupIdLookup = wasAllowed;
      VSASetCode(withError, code == VSAResult::kSuccess ? VSAResult::kInvalidArgument : code);
      return std::nullopt;
    }
    groups.emplace_back(id, std::move(m));
  }
  grants_.allowGroupIdLookup = wasAllowed;
  return groups;
}
