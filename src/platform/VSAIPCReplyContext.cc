#include "platform/VSAIPCReplyContext.h"

#include <utility>

VSAIPCReplyContext::VSAIPCReplyContext(VSAIPCConnectionRef connection,
                                       std::optional<VSAValue> messageID,
                                       VSATransactions::Token transaction,
                                       std::shared_ptr<void> inFlight)
    : connection_(std::move(connection)),
      messageID_(std::move(messageID)),
      transaction_(std::move(transaction)),
      inFlight_(std::move(inFlight)) {}

VSAValue VSAIPCReplyContext::createReply() const {
  VSAValue reply = VSAValue::dictionary();
  if (messageID_) reply.set(kVSAMessageIDKey, *messageID_);
  return reply;
}

bool VSAIPCReplyContext::sendReply(VSAValue reply, VSAErrorRef* error) {
  if (replied_.exchange(true)) {
    VSASetError(error, VSA_ERROR(VSAResult::kInvalidArgument, "This request was already answered"));
    return false;
  }
  if (messageID_) reply.set(kVSAMessageIDKey, *messageID_);
  bool ok = connection_->send(reply, error);
  // Answered: the request no longer holds the daemon or counts as in flight.
  transaction_.reset();
  inFlight_.reset();
  return ok;
}
