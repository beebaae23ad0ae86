#include "base/VSALog.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"

// The reply is sent by the change's completion, which may come at the next
// unlock; only the request's reply context (connection, "MessageID",
// transaction) lives until then, never the request itself.
void VSAHandleSetDataProtection(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                                VSAResultCode* result) {
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
  VSAIPCReplyContextRef context =
      connection.relayMessage() ? connection.relayMessage()->replyContext() : nullptr;
  connection.context().dataProtectionManager->setDataProtectionOnDataContainerForContainerIdentity(
      *identity, static_cast<int32_t>(*protectionClass), args.boolValue("IsThirdParty"),
      args.boolValue("RetryIfLocked"), [context](VSAResultCode code) {
        VSASendLateReply(context, code, VSACommands::kSetDataProtection);
      });
}

void VSASendLateReply(const VSAIPCReplyContextRef& context, VSAResultCode code,
                      VSACommandNumber command) {
  if (!context) return;
  VSAValue reply = context->createReply();
  reply.set("ReplyError", VSAValue(code));
  VSAErrorRef error;
  if (!context->sendReply(reply, &error))
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSASendLateReply",
             "Failed to send reply for command %llu: %@", static_cast<unsigned long long>(command),
             error);
}
