#include "operations/VSAReplaceOperation.h"

#include <exception>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSATestLocks.h"
#include "model/VSAConcreteContainerIdentity.h"
#include "operations/VSAContainerLookup.h"
#include "operations/VSAReplaceFile.h"

namespace {
const char* const kOrigin = "replaceContainerIdentity";

std::string describe(const VSAContainerIdentityRef& identity) {
  return identity ? identity->description() : std::string("(null)");
}

const VSAUUID* uuidOf(const VSAContainerIdentity& identity) {
  return identity.isConcrete() ? &static_cast<const VSAConcreteContainerIdentity&>(identity).uuid()
                               : nullptr;
}

// One replace, step by step. The first failure is kept in `code`; the
// clean-up of step "finish" runs whatever happened.
struct ReplaceRun {
  const VSAOperationServices& services;
  const VSAContainerIdentity& oldIdentity;
  const VSAContainerIdentity& newIdentity;
  bool preserveOldUUID;
  bool startDeletionThread;

  VSAResultCode code = VSAResult::kSuccess;
  VSAMetadataRef oldContainer{}, newContainer{};
  std::string replaceURL{}, stagingURL{}, destURL{};
  bool resultTransient = false;
  bool movedAside = false;  // the old container is in staging
  bool placed = false;      // the new container stands at the destination

  bool fail(VSAResultCode failure, const std::string& message) {
    VSALog(kVSALogError, kOrigin, "%@", message);
    if (code == VSAResult::kSuccess) code = failure;
    return false;
  }

  VSAMetadataRef find(const VSAContainerIdentity& identity) {
    return VSAContainerLookup::containerForIdentity(*services.containerCache, identity);
  }

  bool findBoth() {
    oldContainer = find(oldIdentity);
    if (!oldContainer)
      return fail(VSAResult::kContainerNotFound,
                  VSAFormat("No Container with identity: %@", oldIdentity.description()));
    newContainer = find(newIdentity);
    if (!newContainer)
      return fail(VSAResult::kContainerNotFound,
                  VSAFormat("No Container with identity: %@", newIdentity.description()));
    if (oldContainer->url() == newContainer->url())
      return fail(VSAResult::kSameContainer,
                  VSAFormat("Can't replace the same container at %@", oldContainer->url()));
    if (!VSAUUID::parse(VSALastPathComponent(oldContainer->url())))
      return fail(VSAResult::kNotAUUID,
                  VSAFormat("Invalid URL (last path component not UUID): %@", oldContainer->url()));
    return true;
  }

  bool chooseDestination() {
    if (preserveOldUUID) {
      destURL = oldContainer->url();
      resultTransient = oldContainer->transient();
      return true;
    }
    resultTransient = newContainer->transient();
    auto base = services.configuration->containerDirectoryURLForUserIdentity(
        newIdentity.userIdentity(), newIdentity.containerClass(), resultTransient);
    destURL = VSAPathJoin(base.value_or(""), uuidOf(newIdentity)->string());
    if (!base || services.fileManager->itemExistsAtURL(destURL))
      return fail(VSAResult::kAlreadyExists, VSAFormat("Container already exists at %@", destURL));
    if (resultTransient) return true;
    // The new container's own entry and the old one's are given up by the
    // exchange; any other holder of the identifier would be a twin.
    auto holder = services.containerCache->containerForContainerIdentity(newIdentity, {}, nullptr);
    if (holder && holder->url() != newContainer->url() && holder->url() != oldContainer->url())
      return fail(VSAResult::kAlreadyExists,
                  VSAFormat("Container with identifier: %@, class: %ld, transient: %d already "
                            "exists",
                            newIdentity.identifier(),
                            static_cast<long>(newIdentity.containerClass()), resultTransient));
    return true;
  }

  // The result keeps the old UUID: record it in the new container's metadata
  // file while the new container is still where it was, so that whichever
  // side of the second rename a crash falls, the old path holds a container
  // with the old UUID.
  bool adoptOldUUID() {
    if (!preserveOldUUID || newContainer->uuid() == oldContainer->uuid()) return true;
    VSAMetadata adopted(*newContainer);
    adopted.setUuid(oldContainer->uuid());
    VSAErrorRef error;
    if (adopted.writeMetadataToDiskWithError(*services.configuration, &error)) return true;
    return fail(error ? error->resultCode(VSAResult::kWriteFailed) : VSAResult::kWriteFailed,
                VSAFormat("Failed to write metadata with the old UUID to %@", newContainer->url()));
  }

  bool journal() {
    auto& config = *services.configuration;
    replaceURL = VSAPathJoin(config.replaceDirectory(), VSAUUID::random().string() + ".plist");
    stagingURL = VSAPathJoin(config.stagingDirectoryURLForUserIdentity(
                                 oldIdentity.userIdentity(), oldIdentity.containerClass()),
                             VSAUUID::random().string());
    VSAErrorRef error;
    if (VSAReplaceFile::_writeToDiskReplaceAt(*services.fileManager, replaceURL,
                                              oldContainer->url(), newContainer->url(), stagingURL,
                                              destURL, &error))
      return true;
    replaceURL.clear();  // nothing to discard
    return fail(error ? error->resultCode(VSAResult::kWriteFailed) : VSAResult::kWriteFailed,
                VSAFormat("Failed to write replace file: %@", error));
  }

  bool exchange() {
    auto& fm = *services.fileManager;
    auto& cache = *services.containerCache;
    VSAErrorRef error;
    if (!fm.moveItemAtURL(oldContainer->url(), stagingURL, &error))
      return fail(VSAResult::kMoveToStagingFailed, VSAFormat("Failed to move old %@ to staging %@",
                                                             oldContainer->url(), stagingURL));
    movedAside = true;
    if (!cache.removeContainerForUserIdentity(
            oldContainer->userIdentity(), oldContainer->containerClass(),
            oldContainer->identifier(), oldContainer->transient(), &error))
      return cacheRemovalFailed(*oldContainer);
    VSAErrorRef invalidateError;
    if (!services.codeSigningChanges.invalidateCodeSigningInfoForIdentifierAndItsChildren(
            oldContainer->identifier(), &invalidateError))
      VSALog(kVSALogError, kOrigin, "Failed to invalidate code signing info for %@",
             oldContainer->identifier());
    services.testLocks->waitOnLock(kVSATestLockReplace);
    if (!fm.moveItemAtURL(newContainer->url(), destURL, &error))
      return fail(VSAResult::kMoveToDestinationFailed,
                  VSAFormat("Failed to replace: %@ with: %@ at: %@", oldContainer->url(),
                            newContainer->url(), destURL));
    placed = true;
    return true;
  }

  bool cacheRemovalFailed(const VSAMetadata& m) {
    return fail(VSAResult::kCacheRemoveFailed,
                VSAFormat("Failed to remove from cache id: %@, class: %ld, transient: %d",
                          m.identifier(), static_cast<long>(m.containerClass()), m.transient()));
  }

  bool recache() {
    auto& cache = *services.containerCache;
    if (!cache.removeContainerForUserIdentity(
            newContainer->userIdentity(), newContainer->containerClass(),
            newContainer->identifier(), newContainer->transient(), nullptr))
      return cacheRemovalFailed(*newContainer);
    VSAMetadata result(*newContainer);
    result.setUuid(preserveOldUUID ? oldContainer->uuid() : *uuidOf(newIdentity));
    result.setUrl(destURL);
    result.setTransient(resultTransient);
    if (!cache.addContainerMetadata(result, destURL,
                                    {.transient = resultTransient, .updateSandbox = true}, nullptr))
      return fail(VSAResult::kCacheAddFailed,
                  VSAFormat("Failed to add to cache: %@, url: %@, transient: %d", result, destURL,
                            resultTransient));
    return true;
  }

  // The old container went aside but the new one did not take its place:
  // bring it back where it was and into the cache.
  void restoreOld(const char* format) {
    VSALog(kVSALogNotice, kOrigin, format, stagingURL, oldContainer->url());
    VSAErrorRef error;
    if (!services.fileManager->moveItemAtURL(stagingURL, oldContainer->url(), &error)) {
      VSALog(kVSALogError, kOrigin, "Failed to recover replace move: %@ to %@", stagingURL,
             oldContainer->url());
      return;
    }
    movedAside = false;
    if (!services.containerCache->addContainerMetadata(
            *oldContainer, oldContainer->url(),
            {.transient = oldContainer->transient(), .updateSandbox = true}, &error))
      VSALog(kVSALogError, kOrigin, "Failed to add to cache: %@, url: %@, transient: %d",
             *oldContainer, oldContainer->url(), oldContainer->transient());
  }

  // Staging and the replace file go to death row, unless the old container
  // is still in staging: then both stay for the next start's recovery.
  void finish() {
    if (movedAside && !placed) {
      VSALog(kVSALogError, kOrigin, "Leaving %@ and %@ for recovery at the next start", stagingURL,
             replaceURL);
      return;
    }
    auto& deathRow = *services.deathRow;
    VSAErrorRef error;
    if (!stagingURL.empty() &&
        !deathRow._moveItemAtURLToDeathRow(stagingURL, {.startDeletionThread = startDeletionThread},
                                           &error))
      fail(VSAResult::kRemoveFailed, VSAFormat("Failed to remove staging dir: %@", stagingURL));
    if (!replaceURL.empty() && !deathRow._moveItemAtURLToDeathRow(replaceURL, {}, &error))
      fail(VSAResult::kRemoveFailed, VSAFormat("Failed to remove replace file: %@", replaceURL));
  }

  void run() {
    try {
      if (findBoth() && chooseDestination() && adoptOldUUID() && journal() && exchange())
        recache();
      else if (movedAside && !placed)
        restoreOld("Recovering from failed replace by moving: %@ to %@");
    } catch (const std::exception& e) {
      VSALog(kVSALogError, kOrigin, "Got exception: %@ : %@", "std::exception", e.what());
      if (code == VSAResult::kSuccess) code = VSAResult::kExceptionInTransaction;
      if (movedAside && !placed) restoreOld("Recovering from exception by moving: %@ to %@");
    }
    finish();
  }
};

bool invalidArguments(const VSAContainerIdentityRef& oldIdentity,
                      const VSAContainerIdentityRef& newIdentity, bool preserveOldUUID,
                      VSAResultCode* withError) {
  auto refuse = [&](VSAResultCode code, const std::string& message) {
    VSALog(kVSALogError, kOrigin, "%@", message);
    VSASetCode(withError, code);
    return true;
  };
  const VSAUUID* newUUID = newIdentity ? uuidOf(*newIdentity) : nullptr;
  long newClass = newIdentity ? static_cast<long>(newIdentity->containerClass()) : 0;
  if (!newUUID || !VSAContainerClassIsValid(newIdentity->containerClass()) || !oldIdentity)
    return refuse(VSAResult::kInvalidArgument,
                  VSAFormat("Can't act on an invalid object: newUUID: %@, Class: %ld",
                            newUUID ? newUUID->string() : std::string("(null)"), newClass));
  if (oldIdentity->containerClass() != newIdentity->containerClass())
    return refuse(VSAResult::kDifferentClasses,
                  VSAFormat("Can't replace containers of different class types: %ld and %ld",
                            static_cast<long>(oldIdentity->containerClass()), newClass));
  if (preserveOldUUID && !uuidOf(*oldIdentity))
    return refuse(VSAResult::kInvalidArgument,
                  "Can't have a nil oldContainerUUID when preserving the UUID");
  const auto& a = oldIdentity->userIdentity();
  const auto& b = newIdentity->userIdentity();
  if (a != b && !(a && b && a->isEqualToUserIdentity(*b)))
    return refuse(VSAResult::kInvalidPersona,
                  VSAFormat("Can't replace containers of different personas: %@ and %@",
                            a ? a->description() : std::string("(null)"),
                            b ? b->description() : std::string("(null)")));
  return false;
}
}  // namespace

bool VSAReplaceOperation::replaceContainerIdentity(
    const VSAContainerIdentityRef& oldIdentity,
    const VSAContainerIdentityRef& withContainerIdentity, bool preserveOldUUID,
    bool startDeletionThread, VSAResultCode* withError) {
  if (invalidArguments(oldIdentity, withContainerIdentity, preserveOldUUID, withError))
    return false;
  VSALog(kVSALogNotice, kOrigin, "Replacing %@ with %@ (preserve UUID: %d)", describe(oldIdentity),
         describe(withContainerIdentity), preserveOldUUID);
  VSAResultCode code;
  {
    VSAAllIdentifiersLockGuard lock(*services_.locks, true);
    ReplaceRun run{services_, *oldIdentity, *withContainerIdentity, preserveOldUUID,
                   startDeletionThread};
    run.run();
    code = run.code;
  }
  if (code == VSAResult::kSuccess) return true;
  VSASetCode(withError, code);
  return false;
}

bool VSAReplaceOperation::_recoverFromReplaceOperationsWithError(VSAErrorRef* error) {
  const char* fn = "_recoverFromReplaceOperationsWithError";
  auto& fm = *services_.fileManager;
  std::string directory = services_.configuration->replaceDirectory();
  // A crash while a replace file was written leaves only its temporary file:
  // that replace never moved anything.
  if (int removed = fm.removeUnfinishedWritesInDirectoryAtURL(directory))
    VSALog(kVSALogNotice, fn, "Removed %d unfinished replace files", removed);
  VSAErrorRef listError;
  auto items = fm.urlsForItemsInDirectoryAtURL(directory, &listError);
  if (!items) {
    if (listError && listError->domain() == kVSAPOSIXErrorDomain && listError->code() == ENOENT)
      return true;
    VSALog(kVSALogError, fn, "Failed to get items at replace URL %@ : %@", directory, listError);
    VSASetError(error, listError);
    return false;
  }
  for (const auto& item : *items) {
    auto info = VSAReplaceFile::_readAndValidateReplaceFileAtUrl(fm, item.path, nullptr);
    if (info) {
      VSAValue shown =
          VSAValue::Dictionary{{kVSAReplaceOperationOldURL, VSAValue(info->oldURL)},
                               {kVSAReplaceOperationNewURL, VSAValue(info->newURL)},
                               {kVSAReplaceOperationStagingURL, VSAValue(info->stagingURL)},
                               {kVSAReplaceOperationDestURL, VSAValue(info->destURL)}};
      VSALog(kVSALogDebug, fn, "Doing a replace of %@ with info: %@", item.path, shown);
      if (!fm.itemExistsAtURL(info->oldURL) && !fm.itemExistsAtURL(info->stagingURL)) {
        VSALog(kVSALogError, fn, "Nothing to recover: neither %@ nor %@ exists", info->oldURL,
               info->stagingURL);
      } else if (!fm.itemExistsAtURL(info->oldURL)) {
        VSALog(kVSALogDebug, fn, "Recovering from failed replace by moving: %@ to %@",
               info->stagingURL, info->oldURL);
        VSAErrorRef moveError;
        if (!fm.moveItemAtURL(info->stagingURL, info->oldURL, &moveError)) {
          auto e = VSA_ERROR_UNDERLYING(VSAResult::kInvalidReplaceFile, moveError,
                                        "Failed to recover replace move: %@ to %@",
                                        info->stagingURL, info->oldURL);
          VSALog(kVSALogError, fn, "%@", e->message());
          VSASetError(error, e);
          return false;
        }
      }
    }
    VSAErrorRef removeError;
    if (!services_.deathRow->_moveItemAtURLToDeathRow(item.path, {}, &removeError)) {
      auto e = VSA_ERROR_UNDERLYING(VSAResult::kRemoveFailed, removeError,
                                    "Failed to remove replace file at %@", item.path);
      VSALog(kVSALogError, fn, "%@", e->message());
      VSASetError(error, e);
      return false;
    }
  }
  return true;
}

std::optional<std::set<std::string>> VSAReplaceOperation::stagingURLsAwaitingRecovery() {
  auto& fm = *services_.fileManager;
  std::set<std::string> staged;
  VSAErrorRef listError;
  auto items =
      fm.urlsForItemsInDirectoryAtURL(services_.configuration->replaceDirectory(), &listError);
  if (!items) {
    if (listError && listError->domain() == kVSAPOSIXErrorDomain && listError->code() == ENOENT)
      return staged;  // no directory, no replace in progress
    return std::nullopt;
  }
  for (const auto& item : *items) {
    auto info = VSAReplaceFile::_readAndValidateReplaceFileAtUrl(fm, item.path, nullptr);
    if (!info) return std::nullopt;
    staged.insert(info->stagingURL);
  }
  return staged;
}
