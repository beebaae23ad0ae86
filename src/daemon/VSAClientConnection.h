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
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "daemon/VSAClientIdentity.h"
#include "daemon/VSADaemonContext.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAMetadata.h"
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

  // The container named by `identity`, created first when it is missing and
  // `createIfNecessary` (in staging under a fresh UUID name, then renamed
  // into place). Takes the all-identifiers lock unless `useLocking` is false.
  VSAMetadataRef createOrLookupContainerWithContainerIdentity(
      const VSAContainerIdentityRef& identity, bool createIfNecessary, bool transient,
      bool useLocking, VSAResultCode* withError);
  bool isEntitledForLookupWithClass(VSAContainerClass containerClass,
                                    const std::string& identifier);
  // The identifiers the lookup entitlement lists for a class (nothing when
  // the client has none, or for a class outside 1-13).
  std::optional<std::set<std::string>> _lookupForContainerClass(VSAContainerClass containerClass);
  bool _createTopLevelContainerDirectory(const std::string& url, VSAContainerClass containerClass,
                                         uid_t owner, gid_t group, VSAErrorRef* error);
  bool _createSubDirectories(const std::string& url, const VSAMetadata& containerMetadata,
                             VSAErrorRef* error);
  int32_t _dataProtectionClassForContainerMetadata(const VSAMetadata& metadata);

  // Looks the container up (with the caller's access test) and queues its
  // staging for when the request completes.
  void deleteContainerWithContainerIdentity(const VSAContainerIdentityRef& identity, bool transient,
                                            VSAResultCode* withError);
  // The client's containers of one class (its own user identity).
  std::optional<std::vector<VSAMetadataRef>> containersWithClass(VSAContainerClass containerClass,
                                                                 bool transient,
                                                                 VSAResultCode* withError);
  // A live container's metadata, under its identifier read lock.
  VSAMetadataRef metadataWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                               VSAResultCode* withError);

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
  std::mutex lookupCacheMutex_;
  std::optional<std::map<std::string, std::set<std::string>>> lookupCache_;
};
