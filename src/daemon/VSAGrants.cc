#include "daemon/VSAGrants.h"

#include <cstring>

#include "base/VSALog.h"
#include "daemon/VSAEntitlements.h"

VSAGrants VSADeriveGrants(const VSACommandTableEntry& entry, const VSAClientIdentity* identity) {
  VSAGrants g;
  if (identity) {
    bool testabilityCommand = std::strcmp(entry.entitlement, kVSAEntitlementTestability) == 0;
    if (identity->boolValueOfEntitlement(kVSAEntitlementAllowed)) {
      g.allowOtherIdLookup = true;
      g.unrestricted = !testabilityCommand;
    } else {
      g.allowOtherIdLookup = identity->boolValueOfEntitlement(kVSAEntitlementOtherIdLookup);
      if (entry.honoursLookupEntitlement) {
        const VSAValue* lookup = identity->valueOfEntitlement(kVSAEntitlementLookup);
        if (lookup && lookup->isDictionary()) g.lookup = *lookup;
      }
    }
    if (std::strcmp(entry.entitlement, kVSAEntitlementWipeContainer) == 0) {
      const VSAValue* wipe = identity->valueOfEntitlement(kVSAEntitlementWipeContainer);
      if (wipe && wipe->isArray()) {
        g.entitledWipeIdentifiers = *wipe;
        g.entitled = true;
      } else {
        VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAProcessRelayEvent",
                 "No entitled containers to wipe");
        g.entitled = g.unrestricted;
      }
    } else {
      g.entitled = g.unrestricted || identity->boolValueOfEntitlement(entry.entitlement);
    }
  }
  g.admitted = entry.openToUnentitled || g.entitled || g.lookup.has_value();
  return g;
}
