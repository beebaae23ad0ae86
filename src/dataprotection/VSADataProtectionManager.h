// Decides which protection class a data container should have and runs the
// persisted change operations that give it that class: for requests, and at
// start-up for update files that outlived the previous daemon.
//
// All update files are read, written and deleted on the manager's serial
// queue "com.tamsk.Vessa.ProtectionOperationFileQueue". Requests arrive on
// the listener queue; retries run on the lock-state queue, so a completion
// may run on either. Every request's completion is called exactly once with
// a result code (1 on success). One manager per daemon, owned by its context.
//
// Changes that wait for an unlock are kept per container: at most one change
// (the newest) and one retry on the lock-state queue for each. A request for
// a container whose change is waiting replaces that change (its update file
// already names the newer one), and the replaced request is answered at
// once with kVSAProtectionChangeSupersededResult: its container now gets the
// newer request's class. The completions of waiting changes (which hold the
// callers' reply contexts) are capped at `maxPendingReplies`; a change that
// would go past the cap still waits and runs at the unlock, but its request
// is answered at once with kVSAProtectionChangeAnsweredEarlyResult (logged).
// The termination assertion of a replaced change passes to the newer one, so
// the app stays terminated throughout.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"
#include "dataprotection/VSADataProtectionChangeOperation.h"
#include "dataprotection/VSADataProtectionEnvironment.h"
#include "model/VSAContainerIdentity.h"
#include "operations/VSADataProtectionQueries.h"

// Replies a manager keeps for changes waiting for an unlock, by default.
inline constexpr size_t kVSAMaxPendingProtectionReplies = 1024;
// The answer to a request whose waiting change a newer request for the same
// container replaced: the request was accepted, and the container's pending
// change is now the newer one.
inline constexpr VSAResultCode kVSAProtectionChangeSupersededResult = VSAResult::kSuccess;
// The answer to a request answered before its change ran because too many
// replies were waiting: accepted, persisted, and run at the next unlock.
inline constexpr VSAResultCode kVSAProtectionChangeAnsweredEarlyResult = VSAResult::kSuccess;

class VSADataProtectionManager : public VSADataProtectionQueries {
 public:
  using Completion = std::function<void(VSAResultCode)>;

  explicit VSADataProtectionManager(std::shared_ptr<const VSADataProtectionEnvironment> env,
                                    size_t maxPendingReplies = kVSAMaxPendingProtectionReplies);

  const VSAWorkQueue::Ref& protectionOperationFileQueue() const { return queue_; }

  // The class an identifier's entitlements ask for (0: none or unknown).
  int32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
      const std::string& identifier) override;
  void setDataProtectionOnDataContainerForContainerIdentity(const VSAContainerIdentity& identity,
                                                            int32_t dataProtectionClass,
                                                            bool isSecondOrThirdPartyApp,
                                                            bool retryIfLocked,
                                                            Completion withCompletion);
  // Starts the operation of every readable update file; damaged files are
  // reported and skipped. False only when the directory cannot be listed.
  bool restartPendingDataProtectionOperationsWithError(VSAErrorRef* error) override;
  void _startDataProtectionChangeOperation(const VSADataProtectionChangeOperation::Ref& operation,
                                           Completion withCompletion);

  // The class recorded in a container's metadata (0 when none).
  static int32_t currentProtectionClassOfMetadata(const VSAMetadata& metadata);

  // Changes waiting for an unlock (at most one per container), and how many
  // of them hold a caller's completion.
  size_t pendingChangeCount() const;
  size_t pendingReplyCount() const;

 private:
  struct Request;
  using RequestRef = std::shared_ptr<Request>;
  // The change of one container that waits for an unlock. Present from the
  // moment its retry is queued until that retry runs; `operation` is null
  // when the change was replaced by one that finished without waiting.
  struct Waiting {
    VSADataProtectionChangeOperation::Ref operation;
    RequestRef request;
  };

  void recordProtectionClass(const VSAMetadataRef& metadata, int32_t protectionClass);
  // Answers and drops the change waiting for `key`; its assertion passes to
  // `successor` (or is invalidated when there is none).
  void supersedeWaitingChange(const std::string& key, const RequestRef& successor);
  void scheduleRetry(const std::string& key, const VSADataProtectionChangeOperation::Ref& operation,
                     const RequestRef& request);
  void runRetry(const std::string& key);
  // Takes a request's completion out of the waiting set; caller holds pendingMutex_.
  void _lock_releaseReply(const RequestRef& request);
  static void handOverAssertion(const RequestRef& from, const RequestRef& to);

  std::shared_ptr<const VSADataProtectionEnvironment> env_;
  VSAWorkQueue::Ref queue_;
  size_t maxPendingReplies_;
  mutable std::mutex pendingMutex_;
  std::map<std::string, Waiting> waiting_;  // by update-file path
  size_t pendingReplies_ = 0;
  uint64_t nextSequence_ = 0;
};
