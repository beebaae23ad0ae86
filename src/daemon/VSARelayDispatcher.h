// The request dispatcher (log origin "VSAProcessRelayEvent").
//
// For each message on a peer connection, on the listener queue: first checks
// that the peer still runs the executable its connection pinned when it was
// accepted (a process that has exec'd another program since, or whose socket
// is used by another process after such an exec, must not act with the
// identity resolved for the original one): if not, the connection is dropped
// (logged) and nothing is served. Then reads
// "Command", checks it against the command table (49 for an invalid, absent
// or retired command), builds the client's identity and grants (55 for a
// client that is refused), creates the request's VSAClientConnection and
// command queue, calls the handler, drains the command queue and sends
// exactly one reply carrying "ReplyError" — except for a successful command 4
// or 21, whose handler replies from its completion. A message without reply
// context (an undecodable frame or a body that is not a dictionary) is logged
// and its connection cancelled.
#pragma once

#include <cstddef>

#include "daemon/VSACommandTable.h"
#include "daemon/VSADaemonContext.h"
#include "platform/VSAIPCMessage.h"

inline constexpr const char* kVSARequestCommandKey = "Command";
inline constexpr const char* kVSAReplyErrorKey = "ReplyError";

class VSARelayDispatcher {
 public:
  explicit VSARelayDispatcher(VSADaemonContext& context);
  // A dispatcher over another table (tests of the table checks).
  VSARelayDispatcher(VSADaemonContext& context, const VSACommandTableEntry* table, size_t count);

  // VSAProcessRelayEvent.
  void processRelayEvent(const VSAIPCMessageRef& message);

 private:
  // Reads "Command"; false (after logging) when it is absent or not a number.
  static bool readCommand(const VSAValue& request, uint64_t& command);
  // Returns the entry to run, or null after logging why the command is invalid.
  const VSACommandTableEntry* checkCommand(uint64_t command) const;

  VSADaemonContext& context_;
  const VSACommandTableEntry* table_;
  size_t count_;
};
