#include "daemon/VSAKernelUpcall.h"

#include "base/VSALog.h"
#include "base/VSATestLocks.h"
#include "daemon/VSAClientConnection.h"
#include "platform/VSADescriptorPassing.h"

VSAUpcallEnvironment VSAKernelUpcall::environmentFor(VSADaemonContext& context) {
  VSAUpcallEnvironment env;
  env.userIdentityCache = context.userIdentityCache;
  env.personaService = context.personaService;
  env.isMultiUser = [device = context.deviceProperties] { return device->isMultiUser(); };
  env.rootHomeDirectory = context.systemRoot.resolve("/private/var/root");
  env.dataContainerTypeForIdentifier = [mapping =
                                            context.codeSigningMapping](const std::string& id) {
    return mapping->dataContainerTypeForIdentifier(id);
  };
  env.createOrLookup = [&context](const VSAUserIdentityRef& user, const std::string& id,
                                  VSAContainerClass c,
                                  uint64_t* code) -> std::optional<std::string> {
    VSAClientConnection connection(
        context, VSAClientIdentity::privilegedClientIdentityWithUserIdentity(user, true), true,
        true, true, std::nullopt, std::nullopt, std::make_shared<VSACommandQueue>());
    connection.setAllowGroupIdLookup(true);
    VSAResultCode result = VSAResult::kSuccess;
    auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(user, id, c, &result);
    auto m = identity ? connection.createOrLookupContainerWithContainerIdentity(
                            identity, {.createIfNecessary = true}, &result)
                      : nullptr;
    if (!m) {
      *code = result == VSAResult::kSuccess ? VSAResult::kInvalidArgument : result;
      return std::nullopt;
    }
    return m->url();
  };
  env.copyReplyMemory = [](const std::vector<uint8_t>& bytes) {
    return VSAUniqueFd(VSAMemfdWithBytes("vessa-upcall-reply", bytes, true));
  };
  return env;
}

VSAKernelUpcall::VSAKernelUpcall(VSADaemonContext& context, VSAWorkQueue::Ref targetQueue)
    : context_(context),
      queue_(VSAWorkQueue::create("com.tamsk.vessad.upcall", VSAWorkQueue::Kind::Serial,
                                  std::move(targetQueue))),
      server_(environmentFor(context)) {}

VSAKernelUpcall::~VSAKernelUpcall() { stop(); }

std::unique_ptr<VSAUpcallListener> VSAKernelUpcall::listenerFor(VSADaemonContext& context) {
  return std::make_unique<VSAUpcallListener>(context.systemRoot.upcallSocketPath(),
                                             context.clientRegistry, kVSAUpcallMaxRequestSize);
}

bool VSAKernelUpcall::start(std::unique_ptr<VSAUpcallListener> bound) {
  listener_ = bound ? std::move(bound) : listenerFor(context_);
  VSAErrorRef error;
  bool started = listener_->start(
      [this](VSAUpcallPacket packet, VSAUpcallListener::Reply reply) {
        auto token = context_.transactions->open();
        VSAWorkQueue::Block block = [this, token, packet = std::move(packet),
                                     reply = std::move(reply)]() mutable {
          serve(std::move(packet), reply);
        };
        // Served right here while the queues are idle: no hand-off to a pool
        // thread. Not while test locks may freeze it, so that a frozen upcall
        // holds up only the pool thread it waits on.
        if (!context_.testLocks->enabled() && queue_->runIfIdle(block)) return;
        queue_->async(std::move(block));
      },
      &error);
  if (!started) {
    VSALogIn(VSALogCategory::Upcall, kVSALogError, "start", "bootstrap_check_in: %s",
             error ? error->message() : std::string("unknown error"));
    listener_.reset();
  }
  return started;
}

void VSAKernelUpcall::stop() {
  if (listener_) listener_->stop();
  listener_.reset();
}

void VSAKernelUpcall::serve(VSAUpcallPacket packet, const VSAUpcallListener::Reply& reply) {
  VSAUpcallRequest request = VSAUpcallRequest::parse(packet.message.data(), packet.message.size());
  request.auditToken = packet.auditToken;
  // The memory must have come whole, as exactly one memfd.
  bool memoryOK = !packet.malformedDescriptors && packet.memorySize &&
                  packet.memory.size() == *packet.memorySize;
  uint64_t size = memoryOK ? *packet.memorySize : UINT64_MAX;
  auto outcome = server_.demux_server(request, packet.memory.data(), size);
  reply(outcome.reply.bytes(), std::move(outcome.memory));
}
