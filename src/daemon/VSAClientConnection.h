// One request's view of its client: the identity and the grants the
// dispatcher derived for the command, the request's command queue, and the
// operations that handlers call. Lives for one request (or one boot-time
// run) on the listener queue; not shared between threads.
//
// Grants: `entitled` (the command's operation on the client's own
// identifiers), `allowOtherIdLookup` (other identifiers, non-well-known
// system containers), `allowGroupIdLookup` (group containers the caller is not
// entitled to; kernel only), `unrestricted` (no per-identifier limits),
// `lookup` (the lookup entitlement dictionary) and `entitledWipeIdentifiers`.
#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "daemon/VSAClientIdentity.h"
#include "daemon/VSADaemonContext.h"
#include "operations/VSACommandQueue.h"
#include "platform/VSAIPCMessage.h"

class VSAClientConnection {
 public:
  // initWithClientIdentity:entitled:allowOtherIdLookup:unrestricted:lookup:
  // entitledWipeIdentifiers:commandQueue:
  VSAClientConnection(VSADaemonContext& context, VSAClientIdentityRef clientIdentity, bool entitled,
                      bool allowOtherIdLookup, bool unrestricted, std::optional<VSAValue> lookup,
                      std::optional<VSAValue> entitledWipeIdentifiers,
                      std::shared_ptr<VSACommandQueue> commandQueue);

  // The daemon's own connection, used for boot-time work.
  static std::unique_ptr<VSAClientConnection> sharedClientConnection(VSADaemonContext& context);

  VSADaemonContext& context() const { return context_; }
  const VSAClientIdentityRef& clientIdentity() const { return clientIdentity_; }
  bool entitled() const { return entitled_; }
  bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
  bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
  bool unrestricted() const { return unrestricted_; }
  const std::optional<VSAValue>& lookup() const { return lookup_; }
  const std::optional<VSAValue>& entitledWipeIdentifiers() const {
    return entitledWipeIdentifiers_;
  }
  const std::shared_ptr<VSACommandQueue>& commandQueue() const { return commandQueue_; }
  void setUnrestricted(bool v) { unrestricted_ = v; }
  void setAllowOtherIdLookup(bool v) { allowOtherIdLookup_ = v; }
  void setAllowGroupIdLookup(bool v) { allowGroupIdLookup_ = v; }

  // The IPC message being served; handlers that reply later keep it.
  void setRelayMessage(VSAIPCMessageRef message) { relayMessage_ = std::move(message); }
  const VSAIPCMessageRef& relayMessage() const { return relayMessage_; }

  // Runs the request's deferred commands; a failing command's code lands in `error`.
  bool completeWithError(VSAResultCode* error);

  // Boot-time work: the two setups run synchronously; each cleanup calls its
  // completion when done, possibly later and on another queue.
  void rebootKeeperSetup();
  void keeperSetup();
  void rebootKeeperCleanupWithCompletion(std::function<void()> completion);
  void keeperCleanupWithCompletion(std::function<void()> completion);

 private:
  VSADaemonContext& context_;
  VSAClientIdentityRef clientIdentity_;
  bool entitled_;
  bool allowOtherIdLookup_;
  bool allowGroupIdLookup_ = false;
  bool unrestricted_;
  std::optional<VSAValue> lookup_;
  std::optional<VSAValue> entitledWipeIdentifiers_;
  std::shared_ptr<VSACommandQueue> commandQueue_;
  VSAIPCMessageRef relayMessage_;
};
