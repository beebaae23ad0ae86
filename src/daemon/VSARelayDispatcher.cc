#include "daemon/VSARelayDispatcher.h"

#include "base/VSACommands.h"
#include "base/VSALog.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSAGrants.h"

namespace {
constexpr const char* kOrigin = "VSAProcessRelayEvent";
}

VSARelayDispatcher::VSARelayDispatcher(VSADaemonContext& context)
    : VSARelayDispatcher(context, VSACommandTable().data(), VSACommandTable().size()) {}

VSARelayDispatcher::VSARelayDispatcher(VSADaemonContext& context, const VSACommandTableEntry* table,
                                       size_t count)
    : context_(context), table_(table), count_(count) {}

bool VSARelayDispatcher::readCommand(const VSAValue& request, uint64_t& command) {
  const VSAValue* value = request.get(kVSARequestCommandKey);
  if (!value || !value->isInteger()) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Request without an integer \"Command\": %@", value ? value->description() : "absent");
    command = UINT64_MAX;
    return false;
  }
  auto asUnsigned = value->uint64Value();
  command = asUnsigned ? *asUnsigned : static_cast<uint64_t>(*value->int64Value());
  return true;
}

const VSACommandTableEntry* VSARelayDispatcher::checkCommand(uint64_t command) const {
  if (command >= count_) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "Invalid command index: %lld",
             static_cast<long long>(command));
    return nullptr;
  }
  const VSACommandTableEntry& entry = table_[command];
  if (entry.command != command) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "Invalid command at index %llu",
             command);
    return nullptr;
  }
  if (!entry.handler) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "Invalid command handler: %lld",
             static_cast<long long>(command));
    return nullptr;
  }
  return &entry;
}

void VSARelayDispatcher::processRelayEvent(const VSAIPCMessageRef& message) {
  if (!message->connection()->peerIsUnchanged()) {
    const auto& pinned = message->connection()->executable();
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Dropping %@: the peer no longer runs %@ it connected with",
             message->connection()->description(),
             pinned ? pinned->description() : std::string("the executable"));
    message->connection()->cancel();
    return;
  }
  VSAResultCode result = VSAResult::kSuccess;
  auto reply = message->createReply();
  if (!reply) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Dictionary does not have reply context");
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "Cancelling %@: %s",
             message->connection()->description(), message->problem());
    message->connection()->cancel();
    return;
  }
  const VSAValue& request = message->body();
  uint64_t command = 0;
  bool haveCommand = readCommand(request, command);
  // Signposts are debug lines: their texts are not even formatted below that level.
  bool signposts = VSALogger::enabled(kVSALogDebug);
  uint64_t signpost =
      signposts ? VSASignpostBegin(
                      VSALogCategory::Relay, "RelayEventProcessing",
                      VSAFormat(" command=%{public, signpost.description:attribute}llu ", command))
                : 0;
  const VSACommandTableEntry* entry = haveCommand ? checkCommand(command) : nullptr;
  VSAClientIdentityRef identity;
  if (!entry) {
    result = VSAResult::kInvalidCommand;
  } else {
    auto commandQueue = std::make_shared<VSACommandQueue>();
    const VSAAuditToken& token = message->connection()->auditToken();
    // While this request is served, the thread runs as the client's persona.
    VSACurrentPersonaScope persona(token.pid, token.startTime,
                                   message->connection()->personaRecordMemo());
    identity = VSAClientIdentity::clientIdentityWithRelayConnection(
        *message->connection(), *context_.userIdentityCache, *context_.codeSigningMapping);
    VSAGrants grants = VSADeriveGrants(*entry, identity.get());
    // Command 31 may arrive while a frozen request holds what recording
    // entitlements waits for (the mapping's queue, the identifier locks).
    // A launched app's entitlements are read from the mapping, not presented.
    if (identity && grants.admitted && command != VSACommands::kTestLock &&
        !identity->isLaunchedApp()) {
      VSAResultCode registered = context_.codeSigningMapping->processCallerRegisteredEntitlements(
          identity->entitlements(), identity->bundleIdentifier(), commandQueue.get());
      if (registered != VSAResult::kSuccess)
        VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
                 "Error processing entitlements for %@ : %llu", identity->bundleIdentifier(),
                 registered);
    }
    if (!grants.admitted) {
      VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
               "connection attempt from pid %d (%@) is not entitled",
               message->connection()->auditToken().pid,
               identity ? identity->bundleIdentifier() : std::string("<unknown>"));
      result = VSAResult::kNotEntitled;
    } else {
      VSAClientConnection connection(context_, identity, grants.entitled, grants.allowOtherIdLookup,
                                     grants.unrestricted, grants.lookup,
                                     grants.entitledWipeIdentifiers, commandQueue);
      connection.setRelayMessage(message);
      entry->handler(request, *reply, connection, &result);
      connection.completeWithError(&result);
    }
  }
  std::string client = identity ? identity->bundleIdentifier() : std::string("<unknown>");
  if (signposts)
    VSASignpostEnd(VSALogCategory::Relay, "RelayEventProcessing", signpost,
                   VSAFormat(" command=%{public, signpost.description:attribute}llu  "
                             "clientIdentifier=%{private, signpost.description:attribute}@ ",
                             command, client));
  VSALogIn(VSALogCategory::Relay, kVSALogNotice, kOrigin, "command=%llu, client=%@, error=%llu",
           command, client, result);
  if (result == VSAResult::kSuccess &&
      (command == VSACommands::kDeleteDeathRow || command == VSACommands::kSetDataProtection))
    return;
  reply->set(kVSAReplyErrorKey, VSAValue(result));
  VSAErrorRef error;
  if (!message->sendReply(std::move(*reply), &error)) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Failed to send reply for command %llu: %@", command, error);
  }
}
