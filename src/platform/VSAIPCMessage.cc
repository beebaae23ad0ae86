#include "platform/VSAIPCMessage.h"

VSAIPCMessage::VSAIPCMessage(VSAIPCConnectionRef connection, std::optional<VSAValue> body,
                             std::string problem, VSATransactions::Token transaction,
                             std::shared_ptr<void> inFlight)
    : connection_(std::move(connection)),
      body_(body ? std::move(*body) : VSAValue()),
      problem_(std::move(problem)) {
  if (problem_.empty() && !body_.isDictionary()) problem_ = "message is not a dictionary";
  if (!body_.isDictionary()) {
    transaction_ = std::move(transaction);
    inFlight_ = std::move(inFlight);
    return;
  }
  const VSAValue* id = body_.get(kVSAMessageIDKey);
  replyContext_ = std::make_shared<VSAIPCReplyContext>(
      connection_, id ? std::optional<VSAValue>(*id) : std::nullopt, std::move(transaction),
      std::move(inFlight));
}

std::optional<VSAValue> VSAIPCMessage::createReply() const {
  if (!replyContext_) return std::nullopt;
  return replyContext_->createReply();
}

bool VSAIPCMessage::sendReply(VSAValue reply, VSAErrorRef* error) {
  if (!replyContext_) {
    VSASetError(error, VSA_ERROR(VSAResult::kInvalidArgument, "No reply context for this message"));
    return false;
  }
  return replyContext_->sendReply(std::move(reply), error);
}
