#include "dataprotection/VSADataProtectionChangeOperation.h"

#include <cstring>

#include "base/VSAFormat.h"
#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "base/VSATestLocks.h"
#include "dataprotection/VSADataProtectionUpdateFile.h"

namespace {
constexpr mode_t kUpdateFileMode = 0600;
// The "none" protection class given to update files.
constexpr int kProtectionClassNone = 4;

bool lockedError(const VSAErrorRef& e) {
  return e && e->domain() == kVSAPOSIXErrorDomain && e->code() == VSAFileSystem::kDeviceLockedError;
}
}  // namespace

VSADataProtectionChangeOperation::Ref
VSADataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
    VSAMetadataRef metadata, int32_t settingClass, bool retryingIfLocked, uint32_t changeType,
    VSAWorkQueue::Ref queue, std::shared_ptr<const VSADataProtectionEnvironment> env) {
  return std::make_shared<VSADataProtectionChangeOperation>(
      std::move(metadata), settingClass, retryingIfLocked, changeType, VSAUUID::random(),
      std::move(queue), std::move(env));
}

VSADataProtectionChangeOperation::VSADataProtectionChangeOperation(
    VSAMetadataRef metadata, int32_t newClass, bool retryingIfLocked, uint32_t changeType,
    VSAUUID internalChangeID, VSAWorkQueue::Ref queue,
    std::shared_ptr<const VSADataProtectionEnvironment> env)
    : metadata_(std::move(metadata)),
      newClass_(newClass),
      retryIfLocked_(retryingIfLocked),
      changeType_(changeType),
      internalChangeID_(internalChangeID),
      queue_(std::move(queue)),
      env_(std::move(env)) {}

std::string VSADataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
    const VSAContainerIdentity& identity, VSAGlobalConfiguration& configuration) {
  return VSAPathJoin(configuration.pendingUpdatesDirectory(),
                     VSAFormat("%@-%llu-%@.plist", identity.identifier(),
                               static_cast<unsigned long long>(identity.containerClass()),
                               identity.userIdentity()->identifier()));
}

std::string VSADataProtectionChangeOperation::updateFileURL() const {
  return urlForProtectionOperationWithContainerIdentity(*metadata_->containerIdentity(),
                                                        *env_->configuration);
}

std::string VSADataProtectionChangeOperation::description() const {
  return VSAFormat("<VSADataProtectionChangeOperation %@ class %d changeType %u id %@>",
                   metadata_ ? metadata_->identifier() : std::string("(no container)"), newClass_,
                   changeType_, internalChangeID_);
}

bool VSADataProtectionChangeOperation::writeToDiskWithError(VSAErrorRef* error) {
  bool ok = false;
  queue_->sync([&] { ok = _onQueue_writeToDiskWithError(error); });
  return ok;
}

bool VSADataProtectionChangeOperation::_onQueue_writeToDiskWithError(VSAErrorRef* error) {
  VSACheckOnQueue(*queue_, __func__);
  if (!metadata_ || !isValidChangeType(changeType_)) {
    auto e = VSA_ERROR(VSAResult::kOutOfRange, "Invalid Update Info: metadata: %@, changeType: %u",
                       metadata_ ? metadata_->description() : std::string("(null)"), changeType_);
    VSALog(kVSALogError, __func__, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  VSADataProtectionUpdate update{
      metadata_->identifier(), metadata_->containerClass(), newClass_, changeType_, retryIfLocked_,
      internalChangeID_,       metadata_->userIdentity()};
  std::string url = updateFileURL();
  VSAFileManager& fm = env_->configuration->fileManager();
  VSAErrorRef underlying;
  if (!fm.removeFileAtURL(url, &underlying)) {
    auto e = VSA_ERROR_UNDERLYING(VSAResult::kRemoveFailed, underlying,
                                  "Failed to remove pending data protection file at %@", url);
    VSALog(kVSALogError, __func__, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  if (!VSAWriteDataProtectionUpdate(update, url, fm, kProtectionClassNone, kUpdateFileMode,
                                    &underlying)) {
    auto e =
        VSA_ERROR_UNDERLYING(VSAResult::kWriteFailed, underlying,
                             "Failed to write data protection update dictionary to URL %@", url);
    VSALog(kVSALogError, __func__, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  return true;
}

bool VSADataProtectionChangeOperation::_runChangeOperationNeedToRetry(bool* needRetry,
                                                                      VSAErrorRef* error) {
  *needRetry = false;
  VSAFileManager& fm = env_->configuration->fileManager();
  VSAErrorRef lockedFailure;
  auto visit = [&](const VSAWalkItem& item, VSAFileManager::WalkPhase phase) {
    const std::string& path = item.path;
    const struct stat& st = item.st;
    if (phase == VSAFileManager::WalkPhase::DirectoryEnd || S_ISLNK(st.st_mode)) return true;
    if (path.empty()) {
      VSALog(kVSALogError, "_runChangeOperationNeedToRetry", "itemURL is nil for item: %@",
             metadata_->url());
      return true;
    }
    VSALog(kVSALogDebug, "_runChangeOperationNeedToRetry", "Setting protection class of %s to %d",
           path, newClass_);
    VSAErrorRef failure;
    if (fm.setDataProtectionClassOfItem(item, newClass_, &failure)) return true;
    if (lockedError(failure)) {
      lockedFailure = failure;
      return false;  // every further item would fail the same way
    }
    VSALog(kVSALogError, "_runChangeOperationNeedToRetry",
           "Ignoring failure to set protection class to %d on %@ (mode 0%o): %@", newClass_, path,
           static_cast<unsigned>(st.st_mode & 07777), failure);
    return true;
  };
  // Readers of this container may go on; writers wait for the walk.
  VSAIdentifierLockGuard guard(*env_->locks, VSAValue(metadata_->uuid().string()), false);
  env_->testLocks->waitOnLock(kVSATestLockProtectionChange);
  VSAErrorRef walkError;
  bool walked = fm.traverseDirectory(metadata_->url(), &walkError, visit);
  if (lockedFailure) {
    *needRetry = true;
    VSASetError(error, lockedFailure);
    return false;
  }
  if (!walked) {
    VSALog(kVSALogError, "_runChangeOperationNeedToRetry", "FTS returned error for %s : %s",
           metadata_->url(), walkError ? walkError->message() : std::string("unknown error"));
    VSASetError(error, walkError);
    return false;
  }
  return true;
}

void VSADataProtectionChangeOperation::performChangeOperation() {
  const char* fn = "performChangeOperation";
  const auto& user = metadata_->userIdentity();
  auto containerClass = static_cast<unsigned long long>(metadata_->containerClass());
  bool needRetry = false;
  VSAErrorRef error;
  if (!_runChangeOperationNeedToRetry(&needRetry, &error))
    VSALog(kVSALogNotice, fn,
           "Operation to update protection classes for user: %@, id: %@, containerClass: %llu to "
           "class %d failed with error %@",
           user, metadata_->identifier(), containerClass, newClass_, error);
  if (needRetry && retryIfLocked_) {
    VSALog(kVSALogNotice, fn,
           "Retrying container protection update to %d on next unlock for user: %@, id: %@, "
           "containerClass: %llu",
           newClass_, user, metadata_->identifier(), containerClass);
    scheduleRetry();
    return;
  }
  if (needRetry) {
    error = VSA_ERROR_UNDERLYING(
        VSAResult::kDeviceLocked, error,
        "Tried to update user: %@, id: %@, containerClass: %llu to protection class %d, but was "
        "locked and didn't retry",
        user, metadata_->identifier(), containerClass, newClass_);
    VSALog(kVSALogError, fn, "%@", error->message());
  }
  VSAErrorRef deleteError;
  if (!_deleteUpdateFileWithError(&deleteError))
    VSALog(kVSALogError, fn,
           "Failed to delete update file for user: %@, id: %@, containerClass: %llu, protection "
           "class %d",
           user, metadata_->identifier(), containerClass, newClass_);
  // Dropping the blocks ends any reference cycle through them.
  auto completion = std::move(completionBlock_);
  completionBlock_ = nullptr;
  retryStartBlock_ = nullptr;
  retryScheduler_ = nullptr;
  if (completion) completion(needRetry, error);
}

void VSADataProtectionChangeOperation::scheduleRetry() {
  auto self = shared_from_this();
  if (retryScheduler_) return retryScheduler_(self);
  auto token = env_->transactions ? env_->transactions->open() : nullptr;
  env_->lockStateQueue->async([self, token] { self->retry(); });
}

void VSADataProtectionChangeOperation::retry() {
  if (!retried_ && retryStartBlock_) retryStartBlock_();
  retried_ = true;
  performChangeOperation();
}

bool VSADataProtectionChangeOperation::_deleteUpdateFileWithError(VSAErrorRef* error) {
  bool ok = false;
  queue_->sync([&] { ok = _onQueue_deleteUpdateFileWithError(error); });
  return ok;
}

bool VSADataProtectionChangeOperation::_onQueue_deleteUpdateFileWithError(VSAErrorRef* error) {
  VSACheckOnQueue(*queue_, __func__);
  if (!_onQueue_stillMostCurrentUpdate()) {
    VSALog(kVSALogNotice, __func__,
           "Nothing to delete because there is a newer update for user: %@, id: %@, "
           "containerClass: %llu",
           metadata_->userIdentity(), metadata_->identifier(),
           static_cast<unsigned long long>(metadata_->containerClass()));
    return true;
  }
  return env_->configuration->fileManager().removeFileAtURL(updateFileURL(), error);
}

bool VSADataProtectionChangeOperation::_stillMostCurrentUpdate() {
  bool current = false;
  queue_->sync([&] { current = _onQueue_stillMostCurrentUpdate(); });
  return current;
}

bool VSADataProtectionChangeOperation::_onQueue_stillMostCurrentUpdate() {
  VSACheckOnQueue(*queue_, __func__);
  std::string url = updateFileURL();
  VSAErrorRef error;
  auto dict = VSA_dictionaryWithContentsOfURL(url, kVSAReadBinaryPropertyListOnly, &error,
                                              kVSADataProtectionUpdateFileMaxSize);
  if (!dict) {
    VSALog(kVSALogError, __func__, "Failed to read data protection update from %@", url);
    return false;
  }
  const VSAValue* id = dict->get(kVSADataOperationInternalIDKey);
  std::optional<VSAUUID> uuid =
      id && id->isString() ? VSAUUID::parse(*id->stringValue()) : std::nullopt;
  return uuid && *uuid == internalChangeID_;
}

bool VSADataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(
    const VSAContainerIdentity& identity, VSAGlobalConfiguration& configuration,
    VSAErrorRef* error) {
  return configuration.fileManager().removeFileAtURL(
      urlForProtectionOperationWithContainerIdentity(identity, configuration), error);
}

VSADataProtectionChangeOperation::Ref
VSADataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
    const std::string& url, VSAWorkQueue::Ref queue,
    std::shared_ptr<const VSADataProtectionEnvironment> env, VSAErrorRef* error) {
  auto update = VSADataProtectionUpdate::_readAndValidateDataProtectionUpdateAtURL(
      url, *env->userIdentityCache, error);
  if (!update) return nullptr;
  VSAResultCode code = VSAResult::kSuccess;
  auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(
      update->userIdentity, update->identifier, update->containerClass, &code);
  if (!identity) {
    auto e = VSA_ERROR(code, "Failed to read data protection update at %@", url);
    VSALog(kVSALogError, __func__, "%@", e->message());
    VSASetError(error, e);
    return nullptr;
  }
  VSAErrorRef lookupError;
  VSAMetadataRef metadata = env->containerCache->containerForContainerIdentity(
      *identity, {.updateSandbox = true}, &lookupError);
  if (!metadata) {
    if (!lookupError)
      lookupError =
          VSA_ERROR(VSAResult::kContainerNotFound, "No Container with identity: %@", *identity);
    VSASetError(error, lookupError);
    return nullptr;
  }
  return std::make_shared<VSADataProtectionChangeOperation>(
      std::move(metadata), update->protectionClass, update->retryIfLocked, update->changeType,
      update->internalID, std::move(queue), std::move(env));
}
