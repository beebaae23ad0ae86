// Changes the data-protection class of every item of one data container.
//
// Before it runs, an operation is persisted as an update file in the
// pending-updates directory ("<identifier>-<class>-<user>.plist"), written
// atomically with no protection class so that it can be read while the
// device is locked. A run that meets the locked device either fails (61) or,
// with `retryIfLocked`, is resubmitted to the lock-state queue (suspended
// while locked, so it runs at the next unlock) while the daemon is held
// busy; the update file stays until the change has finished, and is then
// removed only if no newer change for the same container replaced it (two
// changes are told apart by `internalChangeID`).
//
// Update files are read, written and deleted only on `queue` (the `_onQueue_`
// methods assert it); the walk runs where performChangeOperation is called.
// Operations are shared objects: a pending retry keeps its operation alive.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "base/VSAError.h"
#include "base/VSAUUID.h"
#include "base/VSAWorkQueue.h"
#include "dataprotection/VSADataProtectionEnvironment.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAMetadata.h"

// Change types: 1 (a plain change) and 7 (a change towards a stronger class).
inline constexpr uint32_t kVSAProtectionChangeTypeDefault = 1;
inline constexpr uint32_t kVSAProtectionChangeTypeStronger = 7;

class VSADataProtectionChangeOperation
    : public std::enable_shared_from_this<VSADataProtectionChangeOperation> {
 public:
  using Ref = std::shared_ptr<VSADataProtectionChangeOperation>;
  using CompletionBlock = std::function<void(bool needsRetry, const VSAErrorRef& error)>;

  // dataProtectionChangeOperationWithContainerMetadata:settingClass:
  // retryingIfLocked:changeType:queue: (a fresh internalChangeID)
  static Ref dataProtectionChangeOperationWithContainerMetadata(
      VSAMetadataRef metadata, int32_t settingClass, bool retryingIfLocked, uint32_t changeType,
      VSAWorkQueue::Ref queue, std::shared_ptr<const VSADataProtectionEnvironment> env);
  // initWithContainerMetadata:newClass:retryingIfLocked:changeType:
  // internalChangeID:queue:userIdentityCache:
  VSADataProtectionChangeOperation(VSAMetadataRef metadata, int32_t newClass, bool retryingIfLocked,
                                   uint32_t changeType, VSAUUID internalChangeID,
                                   VSAWorkQueue::Ref queue,
                                   std::shared_ptr<const VSADataProtectionEnvironment> env);
  // Rebuilds the operation an update file describes (for the restart at boot).
  static Ref dataProtectionChangeOperationAtURL(
      const std::string& url, VSAWorkQueue::Ref queue,
      std::shared_ptr<const VSADataProtectionEnvironment> env, VSAErrorRef* error);

  const VSAMetadataRef& dataContainerMetadata() const { return metadata_; }
  int32_t newDataProtectionClass() const { return newClass_; }
  bool retryIfLocked() const { return retryIfLocked_; }
  uint32_t changeType() const { return changeType_; }
  const VSAUUID& internalChangeID() const { return internalChangeID_; }
  bool retried() const { return retried_; }
  void setCompletionBlock(CompletionBlock block) { completionBlock_ = std::move(block); }
  void setRetryStartBlock(std::function<void()> block) { retryStartBlock_ = std::move(block); }
  // Takes the retry of a change that met the locked device. Without one the
  // operation submits itself to the lock-state queue; a scheduler that keeps
  // one waiting change per container (the manager) gives its own, and later
  // calls retry() on the operation it chose to run.
  using RetryScheduler = std::function<void(const Ref& operation)>;
  void setRetryScheduler(RetryScheduler scheduler) { retryScheduler_ = std::move(scheduler); }
  // One retry: the retry start block before the first one, then the change.
  void retry();

  bool writeToDiskWithError(VSAErrorRef* error);
  bool _onQueue_writeToDiskWithError(VSAErrorRef* error);
  // Runs the change; see the header comment for retries and completion.
  void performChangeOperation();
  // One walk over the container; `needRetry` when the locked device stopped it.
  bool _runChangeOperationNeedToRetry(bool* needRetry, VSAErrorRef* error);

  bool _deleteUpdateFileWithError(VSAErrorRef* error);
  bool _onQueue_deleteUpdateFileWithError(VSAErrorRef* error);
  bool _stillMostCurrentUpdate();
  bool _onQueue_stillMostCurrentUpdate();

  // Removes a container's update file whatever it holds (missing is success).
  static bool deleteUpdateFileWithContainerIdentity(const VSAContainerIdentity& identity,
                                                    VSAGlobalConfiguration& configuration,
                                                    VSAErrorRef* error);
  static std::string urlForProtectionOperationWithContainerIdentity(
      const VSAContainerIdentity& identity, VSAGlobalConfiguration& configuration);
  static bool isValidChangeType(uint32_t changeType) {
    return changeType == kVSAProtectionChangeTypeDefault ||
           changeType == kVSAProtectionChangeTypeStronger;
  }

  std::string description() const;

 private:
  void scheduleRetry();
  std::string updateFileURL() const;

  VSAMetadataRef metadata_;
  int32_t newClass_;
  bool retryIfLocked_;
  uint32_t changeType_;
  VSAUUID internalChangeID_;
  bool retried_ = false;
  CompletionBlock completionBlock_;
  std::function<void()> retryStartBlock_;
  RetryScheduler retryScheduler_;
  VSAWorkQueue::Ref queue_;
  std::shared_ptr<const VSADataProtectionEnvironment> env_;
};
