// The command table: the single place that binds command numbers to
// handlers and to the entitlement each command requires.
//
// One entry per command of VSACommands, at the index of its number. Flags:
// replyAfterHandler (the dispatcher replies when the handler returns; when
// clear the handler replies itself on success), openToUnentitled (a client
// without the entitlement still reaches the handler, with `entitled` false)
// and honoursLookupEntitlement (a client without "allowed" hands its lookup
// dictionary to the connection). An entry whose handler is null is answered
// with 49 by the dispatcher. Constant; thread-safe.
#pragma once

#include <array>
#include <cstdint>

#include "base/VSACommands.h"
#include "daemon/VSACommandHandlers.h"

struct VSACommandTableEntry {
  VSACommandNumber command;
  VSACommandHandler handler;
  const char* entitlement;
  bool replyAfterHandler;
  bool openToUnentitled;
  bool honoursLookupEntitlement;
};

inline constexpr size_t kVSACommandCount = VSACommands::kCount;

const std::array<VSACommandTableEntry, kVSACommandCount>& VSACommandTable();
