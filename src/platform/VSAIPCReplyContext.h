// What it takes to answer one IPC request later: the connection it came on,
// the "MessageID" the client chose (already bounded by the listener) and the
// request's hold on the daemon, and nothing of the request's body.
//
// Every message with a dictionary body owns one; a handler that answers from
// a completion (after an unlock, say) keeps the context rather than the
// message, so that the request dictionary is freed when dispatch ends. The
// context keeps the request in flight for its connection (and the daemon's
// transaction open) until the reply is sent or the context is dropped, as the
// message did. sendReply() sends at most once, whether through the context
// or through its message. Thread-safe.
#pragma once

#include <atomic>
#include <memory>
#include <optional>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "platform/VSAIPCConnection.h"
#include "platform/VSATransactions.h"

inline constexpr const char* kVSAMessageIDKey = "MessageID";

class VSAIPCReplyContext {
 public:
  // `inFlight` ends the request's in-flight state for its connection when
  // released (may be null).
  VSAIPCReplyContext(VSAIPCConnectionRef connection, std::optional<VSAValue> messageID,
                     VSATransactions::Token transaction, std::shared_ptr<void> inFlight);

  const VSAIPCConnectionRef& connection() const { return connection_; }
  const std::optional<VSAValue>& messageID() const { return messageID_; }
  // A reply dictionary carrying the request's "MessageID".
  VSAValue createReply() const;
  // Sends the reply (with the request's "MessageID"); false (and nothing
  // sent) when a reply was already sent or the peer is gone.
  // Taken by value: the message ID is added to it in place.
  bool sendReply(VSAValue reply, VSAErrorRef* error = nullptr);
  bool replied() const { return replied_.load(); }

 private:
  VSAIPCConnectionRef connection_;
  std::optional<VSAValue> messageID_;
  VSATransactions::Token transaction_;
  std::shared_ptr<void> inFlight_;
  std::atomic<bool> replied_{false};
};

using VSAIPCReplyContextRef = std::shared_ptr<VSAIPCReplyContext>;
