// Decides which protection class a data container should have and runs the
// persisted change operations that give it that class: for requests, and at
// start-up for update files that outlived the previous daemon.
//
// All update files are read, written and deleted on the manager's serial
// queue "com.tamsk.Vessa.ProtectionOperationFileQueue". Requests arrive on
// the listener queue; retries run on the lock-state queue, so a completion
// may run on either. Every request's completion is called exactly once with
// a result code (1 on success). One manager per daemon, owned by its context.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"
#include "dataprotection/VSADataProtectionChangeOperation.h"
#include "dataprotection/VSADataProtectionEnvironment.h"
#include "model/VSAContainerIdentity.h"

inline constexpr const char* kVSAContentProtectionClassInfoKey =
    "com.tamsk.Ferrox.ContentProtectionClass";

class VSADataProtectionManager {
 public:
  using Completion = std::function<void(VSAResultCode)>;

  explicit VSADataProtectionManager(std::shared_ptr<const VSADataProtectionEnvironment> env);

  const VSAWorkQueue::Ref& protectionOperationFileQueue() const { return queue_; }

  // The class an identifier's entitlements ask for (0: none or unknown).
  int32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
      const std::string& identifier);
  void setDataProtectionOnDataContainerForContainerIdentity(const VSAContainerIdentity& identity,
                                                            int32_t dataProtectionClass,
                                                            bool isSecondOrThirdPartyApp,
                                                            bool retryIfLocked,
                                                            Completion withCompletion);
  // Starts the operation of every readable update file; damaged files are
  // reported and skipped. False only when the directory cannot be listed.
  bool restartPendingDataProtectionOperationsWithError(VSAErrorRef* error);
  void _startDataProtectionChangeOperation(const VSADataProtectionChangeOperation::Ref& operation,
                                           Completion withCompletion);

  // The class recorded in a container's metadata (0 when none).
  static int32_t currentProtectionClassOfMetadata(const VSAMetadata& metadata);

 private:
  void recordProtectionClass(const VSAMetadataRef& metadata, int32_t protectionClass);

  std::shared_ptr<const VSADataProtectionEnvironment> env_;
  VSAWorkQueue::Ref queue_;
};
