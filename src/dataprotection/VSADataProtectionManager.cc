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

VSADataProtectionManager::VSADataProtectionManager(
    std::shared_ptr<const VSADataProtectionEnvironment> env)
    : env_(std::move(env)), queue_(VSAWorkQueue::create(kQueueLabel)) {}

int32_t VSADataProtectionManager::currentProtectionClassOfMetadata(const VSAMetadata& metadata) {
  if (!metadata.info()) return 0;
  const VSAValue* value = metadata.info()->get(kVSAContentProtectionClassInfoKey);
  if (!value || !value->isInteger()) return 0;
  return static_cast<int32_t>(value->int64Value().value_or(0));
}

int32_t VSADataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
  auto entitlements = env_->entitlementsForIdentifier ? env_->entitlementsForIdentifier(identifier)
                                                      : std::optional<VSAValue>();
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
      identity, false, true, false, &lookupError);
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
  using Assertion = std::unique_ptr<VSAApplicationTerminationAssertion>;
  auto assertion = std::make_shared<Assertion>();
  VSAMetadataRef metadata = operation->dataContainerMetadata();
  int32_t newClass = operation->newDataProtectionClass();
  bool retryIfLocked = operation->retryIfLocked();
  auto service = env_->terminationService;
  operation->setRetryStartBlock([assertion, service, metadata] {
    // The app stays terminated while its container waits for the unlock.
    *assertion = VSAApplicationTerminationAssertion::initWithBundleIdentifier(
        service.get(), metadata->identifier(), 0);
  });
  operation->setCompletionBlock(
      [this, assertion, metadata, newClass, retryIfLocked, completion = std::move(completion)](
          bool wasLocked, const VSAErrorRef& error) {
        if (*assertion) (*assertion)->invalidate();
        assertion->reset();
        if (wasLocked && retryIfLocked)
          VSALog(kVSALogError, "_startDataProtectionChangeOperation",
                 "Unexpectedly got completion block called with wasLocked");
        if (error) {
          VSALog(kVSALogError, "_startDataProtectionChangeOperation",
                 "Failed to set data protection on container with identifier %@ at %@ to %d: %@",
                 metadata->identifier(), metadata->url(), newClass, error);
          return completion(error->resultCode(VSAResult::kWriteFailed));
        }
        recordProtectionClass(metadata, newClass);
        completion(VSAResult::kSuccess);
      });
  operation->performChangeOperation();
}

void VSADataProtectionManager::recordProtectionClass(const VSAMetadataRef& metadata,
                                                     int32_t protectionClass) {
  VSAIdentifierLockGuard guard(VSAValue(metadata->uuid().string()), true);
  // The change may have waited for an unlock for hours: what the metadata
  // says now is read again under the lock, so that nothing written since is
  // put back to what it was when the request came.
  VSAErrorRef readError;
  VSAMetadataRef current = VSAMetadata::readAndValidateMetadataAtUrl(
      metadata->url(), metadata->userIdentity(), false, *env_->configuration,
      *env_->userIdentityCache, &readError);
  if (!current) {
    VSALog(kVSALogError, "_startDataProtectionChangeOperation",
           "Failed to set protection class info for %@ at %@ to %d : %@", metadata->identifier(),
           metadata->url(), protectionClass, readError);
    return;
  }
  auto updated = std::make_shared<VSAMetadata>(*current);
  VSAValue info = current->info() && current->info()->isDictionary() ? *current->info()
                                                                     : VSAValue::dictionary();
  info.set(kVSAContentProtectionClassInfoKey, static_cast<int64_t>(protectionClass));
  updated->setInfo(info);
  VSAErrorRef error;
  if (!updated->writeMetadataToDiskWithError(*env_->configuration, &error) ||
      !env_->containerCache->addContainerMetadata(*updated, updated->url(), false, false, &error)) {
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
    _startDataProtectionChangeOperation(operation, [](VSAResultCode) {});
  }
  return true;
}
