// Grant derivation: what a client may do for one command, decided from the
// command's table entry and the client's entitlements.
//
// A client holding "allowed" may look up other identifiers and is
// unrestricted (except for testability commands, which "allowed" does not
// imply). Otherwise "otherIdLookup" decides other-id lookups, and commands
// that honour the lookup entitlement carry the client's lookup dictionary.
// The wipe command takes its entitlement's array as the wipe list. A client
// that is neither entitled nor has a lookup dictionary is refused unless the
// command is open to unentitled clients. Pure function; thread-safe.
#pragma once

#include <optional>

#include "base/VSAValue.h"
#include "daemon/VSAClientIdentity.h"
#include "daemon/VSACommandTable.h"

struct VSAGrants {
  bool entitled = false;
  bool allowOtherIdLookup = false;
  bool unrestricted = false;
  std::optional<VSAValue> lookup;
  std::optional<VSAValue> entitledWipeIdentifiers;
  // The client gets a connection for this command (else result 55).
  bool admitted = false;
};

// `identity` may be null (no identity could be built): all grants are false.
VSAGrants VSADeriveGrants(const VSACommandTableEntry& entry, const VSAClientIdentity* identity);
