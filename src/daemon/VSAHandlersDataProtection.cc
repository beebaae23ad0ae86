#include "base/VSALog.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"

// The reply is sent by the change's completion, which may come at the next
// unlock; the request's message (and its transaction) lives until then.
void VSAHandleSetDataProtection(const VSAValue& request, VSAValue& reply,
                                VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  const VSAValue* value = request.get("DataProtectionClass");
  auto protectionClass = value && value->isInteger() ? value->int64Value() : std::nullopt;
  if (!protectionClass || *protectionClass < 0 || *protectionClass > 4) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAHandleSetDataProtection",
             "Invalid DataProtectionClass: %@",
             value ? value->description() : std::string("(none)"));
    args.fail(VSAResult::kInvalidArgument);
    return;
  }
  VSAIPCMessageRef message = connection.relayMessage();
  connection.context().dataProtectionManager->setDataProtectionOnDataContainerForContainerIdentity(
      *identity, static_cast<int32_t>(*protectionClass), args.boolValue("IsThirdParty"),
      args.boolValue("RetryIfLocked"),
      [message, reply](VSAResultCode code) { VSASendLateReply(message, reply, code, 21); });
}

void VSASendLateReply(const VSAIPCMessageRef& message, VSAValue reply, VSAResultCode code,
                      uint64_t command) {
  if (!message) return;
  reply.set("ReplyError", VSAValue(code));
  VSAErrorRef error;
  if (!message->sendReply(reply, &error))
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSASendLateReply",
             "Failed to send reply for command %llu: %@", static_cast<unsigned long long>(command),
             error);
}
