// One received IPC message and its reply context.
//
// A message whose body is a dictionary has a reply context
// (VSAIPCReplyContext): createReply() gives the reply dictionary (carrying
// the request's "MessageID" so that the client can match late replies) and
// sendReply() sends it exactly once, through the message or through the
// context. The request holds a transaction from its receipt until its reply
// is sent or both the message and its context are dropped, so an orderly
// shutdown waits for requests still being served; `inFlight` (given by the
// listener) is released at the same moment. A handler that replies later
// keeps only the context, so the body is freed when dispatch ends. A body
// that is not a dictionary (undecodable frame) has no reply context.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/VSAValue.h"
#include "platform/VSAIPCConnection.h"
#include "platform/VSAIPCReplyContext.h"
#include "platform/VSATransactions.h"

class VSAIPCMessage {
 public:
  VSAIPCMessage(VSAIPCConnectionRef connection, std::optional<VSAValue> body, std::string problem,
                VSATransactions::Token transaction, std::shared_ptr<void> inFlight = nullptr);

  const VSAIPCConnectionRef& connection() const { return connection_; }
  // The decoded body; null when the frame could not be decoded.
  const VSAValue& body() const { return body_; }
  // Why the body could not be used as a request (empty when it can).
  const std::string& problem() const { return problem_; }
  bool hasReplyContext() const { return replyContext_ != nullptr; }
  // Null when there is no reply context.
  const VSAIPCReplyContextRef& replyContext() const { return replyContext_; }

  std::optional<VSAValue> createReply() const;
  // Sends the reply; false (and nothing sent) when a reply was already sent,
  // there is no reply context, or the peer is gone.
  // Taken by value: a caller done with its reply moves it in, and no copy is made.
  bool sendReply(VSAValue reply, VSAErrorRef* error = nullptr);
  bool replied() const { return replyContext_ && replyContext_->replied(); }

 private:
  VSAIPCConnectionRef connection_;
  VSAValue body_;
  std::string problem_;
  VSAIPCReplyContextRef replyContext_;
  // Held here only when there is no reply context to hold them.
  VSATransactions::Token transaction_;
  std::shared_ptr<void> inFlight_;
};

using VSAIPCMessageRef = std::shared_ptr<VSAIPCMessage>;
