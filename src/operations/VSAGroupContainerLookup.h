// The group containers of an owner identifier, for a client: every group
// the owner's entitlements name (application groups for class 7, system
// groups for class 13), each looked up or created for the given user.
//
// A client may ask for its own groups; for another owner's it needs the
// grant for other identifiers (or to be unrestricted), or a lookup
// entitlement listing groups of the class, and then gets only the groups
// listed there. A client with none of these is refused with 55 and told
// nothing about the owner's groups. One object serves one request.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/VSAError.h"
#include "model/VSAMetadata.h"
#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

class VSAGroupContainerLookup {
 public:
  using Groups = std::vector<std::pair<std::string, VSAMetadataRef>>;

  VSAGroupContainerLookup(const VSAOperationServices& services, VSAOperationGrants& grants)
      : services_(services), grants_(grants) {}

  [[nodiscard]] std::optional<Groups> groupContainersForOwnerIdentifier(
      const std::string& owner, const VSAUserIdentityRef& userIdentity,
      VSAContainerClass groupContainerClass, VSAResultCode* withError);
  // The group identifiers alone, with the same access rule.
  [[nodiscard]] std::optional<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
      const std::string& owner, VSAContainerClass groupContainerClass, VSAResultCode* withError);

 private:
  const VSAOperationServices& services_;
  VSAOperationGrants& grants_;
};
