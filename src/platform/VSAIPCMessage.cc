#include "platform/VSAIPCMessage.h"

VSAIPCMessage::VSAIPCMessage(VSAIPCConnectionRef connection, std::optional<VSAValue> body,
                             std::string problem, VSATransactions::Token transaction)
    : connection_(std::move(connection)),
      body_(body ? std::move(*body) : VSAValue()),
      problem_(std::move(problem)),
      transaction_(std::move(transaction)) {
  if (problem_.empty() && !body_.isDictionary()) problem_ = "message is not a dictionary";
}

std::optional<VSAValue> VSAIPCMessage::createReply() const {
  if (!hasReplyContext()) return std::nullopt;
  VSAValue reply = VSAValue::dictionary();
  if (const VSAValue* id = body_.get(kVSAMessageIDKey)) reply.set(kVSAMessageIDKey, *id);
  return reply;
}

bool VSAIPCMessage::sendReply(const VSAValue& reply, VSAErrorRef* error) {
  if (!hasReplyContext() || replied_.exchange(true)) {
    VSASetError(error, VSA_ERROR(VSAResult::kInvalidArgument, "No reply context for this message"));
    return false;
  }
  VSAValue out = reply;
  if (const VSAValue* id = body_.get(kVSAMessageIDKey)) out.set(kVSAMessageIDKey, *id);
  bool ok = connection_->send(out, error);
  transaction_.reset();
  return ok;
}
