// One received IPC message and its reply context.
//
// A message whose body is a dictionary has a reply context: createReply()
// gives the reply dictionary (carrying the request's "MessageID" so that the
// client can match late replies) and sendReply() sends it exactly once. The
// message holds a transaction from its receipt until its reply is sent or it
// is dropped, so an orderly shutdown waits for requests still being served.
// A body that is not a dictionary (undecodable frame) has no reply context.
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>

#include "base/VSAValue.h"
#include "platform/VSAIPCConnection.h"
#include "platform/VSATransactions.h"

inline constexpr const char* kVSAMessageIDKey = "MessageID";

class VSAIPCMessage {
 public:
  VSAIPCMessage(VSAIPCConnectionRef connection, std::optional<VSAValue> body, std::string problem,
                VSATransactions::Token transaction);

  const VSAIPCConnectionRef& connection() const { return connection_; }
  // The decoded body; null when the frame could not be decoded.
  const VSAValue& body() const { return body_; }
  // Why the body could not be used as a request (empty when it can).
  const std::string& problem() const { return problem_; }
  bool hasReplyContext() const { return body_.isDictionary(); }

  std::optional<VSAValue> createReply() const;
  // Sends the reply; false (and nothing sent) when a reply was already sent,
  // there is no reply context, or the peer is gone.
  bool sendReply(const VSAValue& reply, VSAErrorRef* error = nullptr);
  bool replied() const { return replied_.load(); }

 private:
  VSAIPCConnectionRef connection_;
  VSAValue body_;
  std::string problem_;
  VSATransactions::Token transaction_;
  std::atomic<bool> replied_{false};
};

using VSAIPCMessageRef = std::shared_ptr<VSAIPCMessage>;
