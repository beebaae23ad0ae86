// The command table: the single place that binds command numbers to
// handlers and to the entitlement each command requires.
//
// Exactly 33 entries, indexed by command number. Flags: replyAfterHandler
// (the dispatcher replies when the handler returns; when clear the handler
// replies itself on success), openToUnentitled (a client without the
// entitlement still reaches the handler, with `entitled` false) and
// honoursLookupEntitlement (a client without "allowed" hands its lookup
// dictionary to the connection). An entry whose handler is null is answered
// with 49 by the dispatcher. Constant; thread-safe.
#pragma once

#include <array>
#include <cstdint>

#include "daemon/VSACommandHandlers.h"

struct VSACommandTableEntry {
  uint64_t command;
  VSACommandHandler handler;
  const char* entitlement;
  bool replyAfterHandler;
  bool openToUnentitled;
  bool honoursLookupEntitlement;
};

inline constexpr size_t kVSACommandCount = 33;
// Test locks: served on their own queue, so that a request frozen at a test
// lock on the listener queue cannot keep the command that releases it waiting.
inline constexpr uint64_t kVSATestLockCommand = 31;

const std::array<VSACommandTableEntry, kVSACommandCount>& VSACommandTable();
