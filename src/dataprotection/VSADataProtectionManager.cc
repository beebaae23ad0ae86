#include "dataprotection/VSADataProtectionManager.h"

#include <utility>

#include "base/VSAFormat.h"
#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "platform/VSAApplicationTerminationAssertion.h"
#include "platform/VSAFileSystem.h"

namespace {
const char* const kQueueLabel = "com.tamsk.Vessa.ProtectionOperationFileQueue";

struct NamedClass {
  const char* name;
  int32_t protectionClass;
};
constexpr NamedClass kNamedClasses[] = {
    {kVSAFileProtectionComplete, 1},
    {kVSAFileProtectionCompleteUnlessOpen, 2},
    {kVSAFileProtectionWriteOnly, 2},
    {kVSAFileProtectionCompleteUntilFirstUserAuthentication, 3},
    {kVSAFileProtectionCompleteUntilUserAuthentication, 3},
    {kVSAFileProtectionNone, 4},
};
constexpr const char* kEntitlementKeys[] = {"com.tamsk.developer.default-data-protection",
                                            "data-protection-class", "DataProtectionClass"};

// Change type 7 marks a move towards a stronger class.
uint32_t changeTypeFor(int32_t requested, int32_t current) {
  if (requested < current || (requested < 3 && current == 0))
    return kVSAProtectionChangeTypeStronger;
  return kVSAProtectionChangeTypeDefault;
}

VSAResultCode fail(VSAErrorRef e) {
  VSALog(kVSALogError, "setDataProtectionOnDataContainerForContainerIdentity", "%@", e->message());
  return e->resultCode(VSAResult::kInvalidArgument);
}
}  // namespace

// One caller's request for a change: its completion (taken exactly once,
// under pendingMutex_) and the termination assertion that keeps the app
// stopped while the change waits. The assertion is touched only by whoever
// runs the change, or by the manager while the change waits (never both).
struct VSADataProtectionManager::Request {
  uint64_t sequence = 0;
  Completion completion;
  std::unique_ptr<VSAApplicationTerminationAssertion> assertion;
  ~Request() {
    if (assertion) assertion->invalidate();
  }
};

VSADataProtectionManager::VSADataProtectionManager(
    std::shared_ptr<const VSADataProtectionEnvironment> env, size_t maxPendingReplies)
    : env_(std::move(env)),
      queue_(VSAWorkQueue::create(kQueueLabel)),
      maxPendingReplies_(maxPendingReplies) {}

size_t VSADataProtectionManager::pendingChangeCount() const {
  std::lock_guard lock(pendingMutex_);
  size_t count = 0;
  for (const auto& [key, waiting] : waiting_)
    if (waiting.operation) ++count;
  return count;
}

size_t VSADataProtectionManager::pendingReplyCount() const {
  std::lock_guard lock(pendingMutex_);
  return pendingReplies_;
}

int32_t VSADataProtectionManager::currentProtectionClassOfMetadata(const VSAMetadata& metadata) {
  if (!metadata.info()) return 0;
  const VSAValue* value = metadata.info()->get(kVSAContentProtectionClassInfoKey);
  if (!value || !value->isInteger()) return 0;
  return static_cast<int32_t>(value->int64Value().value_or(0));
}

int32_t VSADataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
  auto entitlements = env_->codeSigning->entitlementsForIdentifier(identifier);
  if (!entitlements) return 0;
  const std::string* name = nullptr;
  for (const char* key : kEntitlementKeys) {
    const VSAValue* value = entitlements->get(key);
    if (value && value->isString()) {
      name = value->stringValue();
      break;
    }
  }
  if (!name) return 0;
  for (const auto& named : kNamedClasses)
    if (*name == named.name) return named.protectionClass;
  VSALog(kVSALogError, __func__,
         "Unknown value for DataProtectionClass entitlement: %@; defaulting to class %d", *name, 0);
  return 0;
}

void VSADataProtectionManager::setDataProtectionOnDataContainerForContainerIdentity(
    const VSAContainerIdentity& identity, int32_t dataProtectionClass, bool isSecondOrThirdPartyApp,
    bool retryIfLocked, Completion completion) {
  if (!VSAContainerClassIsPerUser(identity.containerClass()))
    return completion(fail(VSA_ERROR(VSAResult::kInvalidArgument,
                                     "Can't act on an invalid object: identity: %@", identity)));
  VSAErrorRef lookupError;
  VSAMetadataRef metadata = env_->containerCache->containerForContainerIdentity(
      identity, {.updateSandbox = true}, &lookupError);
  if (!metadata)
    return completion(fail(VSA_ERROR_UNDERLYING(VSAResult::kContainerNotFound, lookupError,
                                                "No Container with identity: %@", identity)));
  int32_t current = currentProtectionClassOfMetadata(*metadata);
  if (dataProtectionClass == current) {
    VSAErrorRef deleteError;
    bool deleted = false;
    queue_->sync([&] {
      deleted = VSADataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(
          identity, *env_->configuration, &deleteError);
    });
    if (!deleted) {
      VSALog(kVSALogError, __func__, "Failed to delete existing data protection update file: %@",
             deleteError);
      return completion(VSAResult::kRemoveFailed);
    }
    // A change still waiting for the unlock would undo this request.
    supersedeWaitingChange(
        VSADataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
            identity, *env_->configuration),
        nullptr);
    return completion(VSAResult::kSuccess);
  }
  if (dataProtectionClass == 2)
    return completion(
        fail(VSA_ERROR(VSAResult::kInvalidArgument, "Data protection class %d is not allowed",
                       dataProtectionClass)));
  bool strongClass =
      dataProtectionClass == 0 || dataProtectionClass == 1 || dataProtectionClass == 3;
  if (isSecondOrThirdPartyApp && !strongClass) {
    // A second- or third-party app never weakens its own container.
    VSALog(kVSALogNotice, __func__, "Not changing %@ to class %d for a third-party app", identity,
           dataProtectionClass);
    return completion(VSAResult::kSuccess);
  }
  auto operation =
      VSADataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
          metadata, dataProtectionClass, retryIfLocked, changeTypeFor(dataProtectionClass, current),
          queue_, env_);
  VSAErrorRef writeError;
  if (!operation->writeToDiskWithError(&writeError)) {
    VSALog(kVSALogError, __func__, "Failed to write data protection update for %@: %@", identity,
           writeError);
    return completion(writeError->resultCode(VSAResult::kWriteFailed));
  }
  _startDataProtectionChangeOperation(operation, std::move(completion));
}

void VSADataProtectionManager::_startDataProtectionChangeOperation(
    const VSADataProtectionChangeOperation::Ref& operation, Completion completion) {
  auto request = std::make_shared<Request>();
  request->completion = std::move(completion);
  {
    std::lock_guard lock(pendingMutex_);
    request->sequence = ++nextSequence_;
  }
  VSAMetadataRef metadata = operation->dataContainerMetadata();
  std::string key =
      VSADataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
          *metadata->containerIdentity(), *env_->configuration);
  // This change's update file has replaced that of any change still waiting
  // for the unlock; running both would only let the older one win or lose by
  // timing.
  supersedeWaitingChange(key, request);
  int32_t newClass = operation->newDataProtectionClass();
  bool retryIfLocked = operation->retryIfLocked();
  auto service = env_->terminationService;
  operation->setRetryStartBlock([request, service, metadata] {
    // The app stays terminated while its container waits for the unlock.
    if (!request->assertion)
      request->assertion = VSAApplicationTerminationAssertion::initWithBundleIdentifier(
          service.get(), metadata->identifier(), 0);
  });
  operation->setRetryScheduler(
      [this, key, request](const VSADataProtectionChangeOperation::Ref& waiting) {
        scheduleRetry(key, waiting, request);
      });
  operation->setCompletionBlock(
      [this, request, metadata, newClass, retryIfLocked](bool wasLocked, const VSAErrorRef& error) {
        if (request->assertion) request->assertion->invalidate();
        request->assertion.reset();
        if (wasLocked && retryIfLocked)
          VSALog(kVSALogError, "_startDataProtectionChangeOperation",
                 "Unexpectedly got completion block called with wasLocked");
        VSAResultCode code = VSAResult::kSuccess;
        if (error) {
          VSALog(kVSALogError, "_startDataProtectionChangeOperation",
                 "Failed to set data protection on container with identifier %@ at %@ to %d: %@",
                 metadata->identifier(), metadata->url(), newClass, error);
          code = error->resultCode(VSAResult::kWriteFailed);
        } else {
          recordProtectionClass(metadata, newClass);
        }
        Completion completion;
        {
          std::lock_guard lock(pendingMutex_);
          completion = std::move(request->completion);
          request->completion = nullptr;
        }
        // Nothing left when the request was answered before its change ran.
        if (completion) completion(code);
      });
  operation->performChangeOperation();
}

void VSADataProtectionManager::_lock_releaseReply(const RequestRef& request) {
  if (request && request->completion) --pendingReplies_;
}

void VSADataProtectionManager::handOverAssertion(const RequestRef& from, const RequestRef& to) {
  if (!from || !from->assertion) return;
  if (to && !to->assertion) {
    to->assertion = std::move(from->assertion);
    return;
  }
  from->assertion->invalidate();
  from->assertion.reset();
}

void VSADataProtectionManager::supersedeWaitingChange(const std::string& key,
                                                      const RequestRef& successor) {
  RequestRef replaced;
  Completion answer;
  {
    std::lock_guard lock(pendingMutex_);
    auto it = waiting_.find(key);
    if (it == waiting_.end() || !it->second.operation) return;
    // Its retry stays queued and runs whatever waits for this container then.
    replaced = std::move(it->second.request);
    it->second.operation.reset();
    _lock_releaseReply(replaced);
    if (replaced) answer = std::move(replaced->completion);
    if (replaced) replaced->completion = nullptr;
    // The replaced change is not running (its retry has not started) and the
    // successor has not started either; under the lock, no other request
    // can reach either of them.
    handOverAssertion(replaced, successor);
  }
  VSALog(kVSALogNotice, "_startDataProtectionChangeOperation",
         "Protection change waiting for an unlock at %@ replaced by a newer request; answering "
         "the older request with %llu",
         key, kVSAProtectionChangeSupersededResult);
  if (answer) answer(kVSAProtectionChangeSupersededResult);
}

void VSADataProtectionManager::scheduleRetry(const std::string& key,
                                             const VSADataProtectionChangeOperation::Ref& operation,
                                             const RequestRef& request) {
  RequestRef loser;
  Completion supersededAnswer;
  Completion earlyAnswer;
  size_t waitingReplies = 0;
  bool queueRetry = false;
  {
    std::lock_guard lock(pendingMutex_);
    auto [it, inserted] = waiting_.try_emplace(key);
    Waiting& waiting = it->second;
    queueRetry = inserted;
    // Another change for this container went to wait in the meantime (it
    // was running when this one started): the newer request stays.
    if (waiting.operation && waiting.request && request &&
        waiting.request->sequence > request->sequence) {
      loser = request;
    } else {
      loser = std::move(waiting.request);
      waiting.operation = operation;
      waiting.request = request;
      if (request && request->completion) {
        if (pendingReplies_ < maxPendingReplies_) {
          ++pendingReplies_;
        } else {
          earlyAnswer = std::move(request->completion);
          request->completion = nullptr;
          waitingReplies = pendingReplies_;
        }
      }
    }
    if (loser) {
      if (loser != request) _lock_releaseReply(loser);
      supersededAnswer = std::move(loser->completion);
      loser->completion = nullptr;
      // Under the lock: once `request` waits, a newer request may take it over.
      handOverAssertion(loser, loser == request ? waiting.request : request);
    }
  }
  if (loser) {
    VSALog(kVSALogNotice, "_startDataProtectionChangeOperation",
           "Protection change waiting for an unlock at %@ replaced by a newer request; answering "
           "the older request with %llu",
           key, kVSAProtectionChangeSupersededResult);
    if (supersededAnswer) supersededAnswer(kVSAProtectionChangeSupersededResult);
  }
  if (earlyAnswer) {
    VSALog(kVSALogError, "_startDataProtectionChangeOperation",
           "Too many protection change requests waiting for an unlock (%zu): answering the request "
           "for %@ now with %llu; its change still runs at the next unlock",
           waitingReplies, key, kVSAProtectionChangeAnsweredEarlyResult);
    earlyAnswer(kVSAProtectionChangeAnsweredEarlyResult);
  }
  if (!queueRetry) return;
  // One retry per container, run at the next unlock while the daemon is held busy.
  auto token = env_->transactions ? env_->transactions->open() : nullptr;
  env_->lockStateQueue->async([this, key, token] { runRetry(key); });
}

void VSADataProtectionManager::runRetry(const std::string& key) {
  VSADataProtectionChangeOperation::Ref operation;
  {
    std::lock_guard lock(pendingMutex_);
    auto it = waiting_.find(key);
    if (it == waiting_.end()) return;
    operation = std::move(it->second.operation);
    _lock_releaseReply(it->second.request);
    waiting_.erase(it);
  }
  // Gone when the change was replaced by one that did not need to wait.
  if (operation) operation->retry();
}

void VSADataProtectionManager::recordProtectionClass(const VSAMetadataRef& metadata,
                                                     int32_t protectionClass) {
  VSAIdentifierLockGuard guard(*env_->locks, VSAValue(metadata->uuid().string()), true);
  // The change may have waited for an unlock for hours: what the metadata
  // says now is read again under the lock, so that nothing written since is
  // put back to what it was when the request came.
  VSAErrorRef readError;
  VSAMetadataRef current = VSAMetadata::rereadMetadataOfCachedContainer(
      *metadata, *env_->configuration, *env_->userIdentityCache, &readError);
  if (!current) {
    VSALog(kVSALogError, "_startDataProtectionChangeOperation",
           "Failed to set protection class info for %@ at %@ to %d : %llu", metadata->identifier(),
           metadata->url(), protectionClass,
           readError ? readError->resultCode(VSAResult::kMetadataUnreadable)
                     : VSAResult::kMetadataUnreadable);
    return;
  }
  auto updated = std::make_shared<VSAMetadata>(*current);
  VSAValue info = current->info() && current->info()->isDictionary() ? *current->info()
                                                                     : VSAValue::dictionary();
  info.set(kVSAContentProtectionClassInfoKey, static_cast<int64_t>(protectionClass));
  updated->setInfo(info);
  VSAErrorRef error;
  if (!updated->writeMetadataToDiskWithError(*env_->configuration, &error) ||
      !env_->containerCache->addContainerMetadata(*updated, updated->url(), {}, &error)) {
    VSALog(kVSALogError, "_startDataProtectionChangeOperation",
           "Failed to set protection class info for %@ at %@ to %d : %llu", metadata->identifier(),
           metadata->url(), protectionClass,
           error ? error->resultCode(VSAResult::kWriteFailed) : VSAResult::kWriteFailed);
  }
}

bool VSADataProtectionManager::restartPendingDataProtectionOperationsWithError(VSAErrorRef* error) {
  std::string directory = env_->configuration->pendingUpdatesDirectory();
  VSAFileManager& fm = env_->configuration->fileManager();
  if (fm.itemDoesNotExistAtURL(directory)) return true;
  // A crash inside an update file's atomic write leaves its temporary file;
  // the update it would have carried was never started, so it simply goes.
  if (int removed = fm.removeUnfinishedWritesInDirectoryAtURL(directory))
    VSALog(kVSALogNotice, __func__, "Removed %d unfinished update files in %@", removed, directory);
  VSAErrorRef listError;
  auto items = fm.urlsForItemsInDirectoryAtURL(directory, &listError);
  if (!items) {
    auto e = VSA_ERROR_UNDERLYING(VSAResult::kInvalidArgument, listError,
                                  "Failed to get items at pendingUpdates URL %@ : %@", directory,
                                  listError);
    VSALog(kVSALogError, __func__, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  for (const auto& item : *items) {
    if (item.isDirectory) continue;
    VSALog(kVSALogNotice, __func__, "Found pending data protection operation at %@", item.path);
    VSADataProtectionChangeOperation::Ref operation;
    VSAErrorRef readError;
    queue_->sync([&] {
      operation = VSADataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
          item.path, queue_, env_, &readError);
    });
    if (!operation) {
      VSALog(kVSALogError, __func__, "Failed to read data protection change operation at %@ : %@",
             item.path, readError);
      continue;
    }
    const VSAMetadataRef& m = operation->dataContainerMetadata();
    VSALog(kVSALogNotice, __func__,
           "Starting pending data protection update to protection class %d for user: %@, ID: %@, "
           "containerClass: %llu",
           operation->newDataProtectionClass(), m->userIdentity(), m->identifier(),
           static_cast<unsigned long long>(m->containerClass()));
    _startDataProtectionChangeOperation(operation, nullptr);
  }
  return true;
}
