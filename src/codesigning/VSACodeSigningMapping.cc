#include "codesigning/VSACodeSigningMapping.h"

#include <exception>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "model/VSAContainerIdentity.h"
#include "operations/VSACommandStageForDelete.h"

namespace {
constexpr const char* kOrigin = "VSACodeSigningMapping";

template <typename... A>
void logMapping(int level, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::CodeSignMapping, level, kOrigin, format, args...);
}

bool flagOption(const VSAValue& options, const char* key) {
  const VSAValue* v = options.get(key);
  return v && v->boolValue().value_or(false);
}
}  // namespace

VSACodeSigningMapping::VSACodeSigningMapping(
    std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
    std::shared_ptr<VSAGlobalConfiguration> configuration, std::unique_ptr<VSASQLiteDB> mappingDB,
    std::shared_ptr<VSALocks> locks)
    : userIdentityCache_(std::move(userIdentityCache)),
      configuration_(std::move(configuration)),
      queue_(VSAWorkQueue::create("com.tamsk.Vessa.EntitlementQueue")),
      codeSigningMappingDB_(std::move(mappingDB)),
      locks_(std::move(locks)) {
  queue_->sync([this] { _onQueue_migrateFromMappingFileToDBIfNecessary(); });
}

void VSACodeSigningMapping::_onQueue_migrateFromMappingFileToDBIfNecessary() {
  std::string path = VSAPathJoin(configuration_->libraryDirectory(), "vsa_code_signing_info.plist");
  VSAErrorRef error;
  auto file = VSA_dictionaryWithContentsOfURL(path, 0, &error);
  if (!file) {
    if (error && !(error->domain() == kVSAPOSIXErrorDomain && error->code() == ENOENT))
      logMapping(kVSALogError, "Failed to read code signing mapping file at %@ : %@", path, error);
    return;
  }
  logMapping(kVSALogNotice, "Migrating code signing info from file to DB");
  uint16_t migrated = 0, failed = 0;
  for (const auto& [identifier, serialized] : *file->dictionaryValue()) {
    VSACodeSigningEntry entry = VSACodeSigningEntry::initWithSerializedDictionary(serialized);
    VSAErrorRef addError;
    if (codeSigningMappingDB_->addCodeSigningEntry(&entry, &identifier, &addError)) {
      ++migrated;
    } else {
      ++failed;
      logMapping(kVSALogError, "Failed to migrate code signing entry for %@ : %@", identifier,
                 addError);
    }
  }
  logMapping(kVSALogNotice, "Successfully migrated %d entries, failed to migrate %d", migrated,
             failed);
  // Entries that failed are given up once anything migrated (the file goes).
  if (migrated > 0) {
    VSAErrorRef removeError;
    if (!configuration_->fileManager().removeFileAtURL(path, &removeError))
      logMapping(kVSALogError, "Failed to remove legacy code signing mapping file: %@",
                 removeError);
  }
}

std::optional<VSACodeSigningEntry> VSACodeSigningMapping::_onQueue_entry(
    const std::string& identifier, VSAErrorRef* error) {
  VSACheckOnQueue(*queue_, __func__);
  VSAErrorRef e;
  auto entry = codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier, &e);
  if (!entry && e && !VSASQLiteDB::isNotFound(e)) {
    logMapping(kVSALogError, "Error retrieving entry from DB with identifier %@ : %@", identifier,
               e);
    VSASetError(error, e);
  }
  return entry;
}

std::optional<VSAValue> VSACodeSigningMapping::_onQueue_entitlementsForIdentifier(
    const std::string& identifier) {
  auto entry = _onQueue_entry(identifier, nullptr);
  if (!entry) return std::nullopt;
  const VSAValue* e = entry->codeSigningInfo().get(kVSAEntitlementsKey);
  if (!e || !e->isDictionary()) return std::nullopt;
  return *e;
}

std::optional<VSAValue> VSACodeSigningMapping::entitlementsForIdentifier(
    const std::string& identifier) {
  return sync([&] { return _onQueue_entitlementsForIdentifier(identifier); });
}

VSAResultCode VSACodeSigningMapping::processCodeSigningInfo(const std::optional<VSAValue>& info,
                                                            const std::string* identifier,
                                                            const VSAValue& options,
                                                            VSACommandQueue* commandQueue) {
  if (!identifier) return VSAResult::kMissingIdentifier;
  return sync([&] {
    auto old = _onQueue_entitlementsForIdentifier(*identifier);
    return _onQueue_processCodeSigningInfo(info, *identifier, options, old, commandQueue);
  });
}

void VSACodeSigningMapping::_onQueue_queueSystemContainerDeletion(const std::string& identifier,
                                                                  VSACommandQueue* commandQueue) {
  VSAResultCode code = VSAResult::kSuccess;
  auto identity = VSAContainerIdentity::containerIdentityWithIdentifier(
      identifier, VSAClass::kSystemData, *userIdentityCache_, &code);
  if (!identity) {
    logMapping(kVSALogError, "Failed to create system container identity for %@: %@", identifier,
               code);
    return;
  }
  logMapping(kVSALogNotice,
             "Deleting system container for ID: %@ because it is no longer in the entitlements",
             identifier);
  if (commandQueue)
    commandQueue->insertCommand(
        VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            stageEnvironment_, {identity}, true, [identifier](VSAResultCode c) {
              logMapping(kVSALogError,
                         "Failed to destroy system container with identifier %@: %llu", identifier,
                         c);
            }));
}

VSAResultCode VSACodeSigningMapping::_onQueue_processCodeSigningInfo(
    const std::optional<VSAValue>& info, const std::string& identifier, const VSAValue& options,
    const std::optional<VSAValue>& oldEntitlements, VSACommandQueue* commandQueue) {
  VSACheckOnQueue(*queue_, __func__);
  try {
    std::vector<std::optional<VSACodeSigningEntry>> values;
    std::vector<std::string> identifiers;
    VSAErrorRef error;
    auto current = _onQueue_entry(identifier, &error);
    if (error) return error->resultCode(VSAResult::kDatabaseFailed);
    const VSAValue* cls = options.get(kVSAOptionDataContainerClass);
    VSACodeSigningEntry entry(
        VSAValue(), cls ? cls->uint64Value().value_or(VSAClass::kUndefined) : VSAClass::kUndefined);
    if (const VSAValue* parent = options.get(kVSAOptionParentBundleID);
        parent && parent->isString()) {
      const std::string& parentID = *parent->stringValue();
      auto parentEntry = _onQueue_entry(parentID, nullptr);
      // A parent without an entry gets one that holds only its child list.
      if (!parentEntry) parentEntry = VSACodeSigningEntry(VSAValue::dictionary());
      auto children = parentEntry->childBundleIdentifiers().value_or(std::vector<std::string>{});
      if (std::find(children.begin(), children.end(), identifier) == children.end()) {
        children.push_back(identifier);
        parentEntry->setChildBundleIdentifiers(children);
        logMapping(kVSALogDebug, "Staging Child Bundles: %@ for parent ID: %@ by appending: %@",
                   parentEntry->serialize(), parentID, identifier);
        values.push_back(parentEntry);
        identifiers.push_back(parentID);
      }
    }
    // The deletions a change calls for wait here until the change is
    // written: while the stored entries still name a container, it stays.
    VSACommandQueue deletions;
    VSACommandQueue* pending = commandQueue ? &deletions : nullptr;
    if (flagOption(options, kVSAOptionRegByCaller)) entry.setRegisteredByCaller(true);
    if (flagOption(options, kVSAOptionPlaceholder)) entry.setPlaceholder(true);
    if (flagOption(options, kVSAOptionAdvanceCopy)) entry.setAdvanceCopy(true);
    if (info) entry.setCodeSigningInfo(*info);
    // Keep the stored child list: it belongs to the row, not to the registration.
    if (current) entry.setChildBundleIdentifiers(current->childBundleIdentifiers());
    if (!(current && current->isEqual(entry))) {
      const VSAValue* newEntitlements = info ? info->get(kVSAEntitlementsKey) : nullptr;
      const VSAValue* oldE = oldEntitlements ? &*oldEntitlements : nullptr;
      auto flag = [](const VSAValue* e) {
        const VSAValue* v = e ? e->get(kVSAEntitlementSystemContainer) : nullptr;
        return v && v->boolValue().value_or(false);
      };
      if (flag(oldE) && !flag(newEntitlements))
        _onQueue_queueSystemContainerDeletion(identifier, pending);
      auto newApp = copyApplicationGroupEntitlementForIdentifier(identifier, newEntitlements,
                                                                 kVSAEntitlementApplicationGroups);
      auto oldApp = copyApplicationGroupEntitlementForIdentifier(identifier, oldE,
                                                                 kVSAEntitlementApplicationGroups);
      if (newApp || oldApp)
        _onQueue_handleChangeFromOldGroupContainerIds(oldApp, newApp, kVSAGroupTypeApplication,
                                                      pending);
      auto newSystem = systemGroupIds(identifier, newEntitlements, false);
      auto oldSystem = systemGroupIds(identifier, oldE, true);
      if (newSystem || oldSystem)
        _onQueue_handleChangeFromOldGroupContainerIds(oldSystem, newSystem, kVSAGroupTypeSystem,
                                                      pending);
      auto list = [](const std::optional<std::vector<std::string>>& l) {
        std::string s = "(";
        for (const auto& id : l.value_or(std::vector<std::string>{}))
          s += (s.size() > 1 ? ", " : "") + id;
        return s + ")";
      };
      logMapping(kVSALogNotice,
                 "Reconciled; old app groups: %@, new app groups: %@, old system groups: %@, new "
                 "system groups: %@",
                 list(oldApp), list(newApp), list(oldSystem), list(newSystem));
      values.push_back(info ? std::optional<VSACodeSigningEntry>(entry) : std::nullopt);
      identifiers.push_back(identifier);
    }
    if (values.empty()) return VSAResult::kSuccess;
    VSAResultCode written = _onQueue_setCodeSigningDictionaryValues(values, identifiers);
    if (written != VSAResult::kSuccess) {
      if (deletions.count() > 0)
        logMapping(kVSALogError,
                   "Keeping the containers that the entry of %@ names: it was not written (%llu)",
                   identifier, written);
      return written;
    }
    for (const auto& command : deletions.pendingCommands()) commandQueue->insertCommand(command);
    return VSAResult::kSuccess;
  } catch (const std::exception& e) {
    logMapping(kVSALogError, "Got exception: %@ : %@", "std::exception", e.what());
    return VSAResult::kExceptionInTransaction;
  }
}

VSAResultCode VSACodeSigningMapping::_onQueue_setCodeSigningDictionaryValues(
    const std::vector<std::optional<VSACodeSigningEntry>>& values,
    const std::vector<std::string>& identifiers) {
  if (values.size() != identifiers.size()) {
    logMapping(kVSALogError, "Can't act on an invalid input: values count: %ld, IDs count: %ld",
               static_cast<long>(values.size()), static_cast<long>(identifiers.size()));
    return VSAResult::kInvalidArgument;
  }
  for (size_t i = 0; i < values.size(); ++i) {
    const std::string& id = identifiers[i];
    VSAErrorRef error;
    auto current = _onQueue_entry(id, &error);
    if (error) return error->resultCode(VSAResult::kDatabaseFailed);
    bool staged = values[i] && !values[i]->codeSigningInfo().isNull();
    if ((!current && !staged) || (current && staged && current->isEqual(*values[i]))) continue;
    if (!staged) {
      if (!codeSigningMappingDB_->deleteCodeSigningEntryWithIdentifier(&id, &error)) {
        logMapping(kVSALogError, "Failed to delete code signing info from DB for %@ : %@", id,
                   error);
        return error ? error->resultCode(VSAResult::kDatabaseFailed) : VSAResult::kDatabaseFailed;
      }
      logMapping(kVSALogNotice, "Deleted Code Signing Mapping for ID: %@", id);
    } else {
      if (!codeSigningMappingDB_->addCodeSigningEntry(&*values[i], &id, &error)) {
        logMapping(kVSALogError, "Failed to write code signing info to DB for %@ : %@", id, error);
        return error ? error->resultCode(VSAResult::kDatabaseFailed) : VSAResult::kDatabaseFailed;
      }
      logMapping(kVSALogNotice, "Set Code Signing Mapping for ID: %@ : %@", id, *values[i]);
    }
  }
  return VSAResult::kSuccess;
}

namespace {
// Distinct callers remembered before the memory of recorded entitlements starts over.
constexpr size_t kRecordedEntitlementsLimit = 4096;
}  // namespace

VSAResultCode VSACodeSigningMapping::processCallerRegisteredEntitlements(
    const VSAValue& entitlements, const std::string& identifier, VSACommandQueue* commandQueue) {
  return sync([&]() -> VSAResultCode {
    // Every request records its caller's entitlements; while the database
    // has not changed since they were last found (or made) so, the answer
    // is the same without reading the entry again.
    auto known = recordedEntitlements_.find(identifier);
    if (known != recordedEntitlements_.end() &&
        known->second.changeCount == codeSigningMappingDB_->changeCount() &&
        known->second.entitlements == entitlements)
      return VSAResult::kSuccess;
    VSAResultCode result =
        _onQueue_recordCallerEntitlements(entitlements, identifier, commandQueue);
    if (result == VSAResult::kSuccess) {
      if (recordedEntitlements_.size() >= kRecordedEntitlementsLimit) recordedEntitlements_.clear();
      recordedEntitlements_[identifier] = {codeSigningMappingDB_->changeCount(), entitlements};
    }
    return result;
  });
}

VSAResultCode VSACodeSigningMapping::_onQueue_recordCallerEntitlements(
    const VSAValue& entitlements, const std::string& identifier, VSACommandQueue* commandQueue) {
  VSAErrorRef error;
  auto stored = _onQueue_entry(identifier, &error);
  if (error) return error->resultCode(VSAResult::kDatabaseFailed);
  if (stored) {
    if (!stored->isRegisteredByCaller()) return VSAResult::kSuccess;  // a signature wins
    const VSAValue* old = stored->codeSigningInfo().get(kVSAEntitlementsKey);
    if (old && *old == entitlements) return VSAResult::kSuccess;
    logMapping(kVSALogNotice, "%@ has changed entitlements. Re-registering.", identifier);
  }
  VSAValue info = VSAValue::Dictionary{{kVSAEntitlementsKey, entitlements}};
  VSAValue options = VSAValue::Dictionary{{kVSAOptionRegByCaller, VSAValue(true)}};
  return _onQueue_processCodeSigningInfo(
      info, identifier, options, _onQueue_entitlementsForIdentifier(identifier), commandQueue);
}

std::optional<VSAValue> VSACodeSigningMapping::getCodeSigningInfoForIdentifier(
    const std::string& identifier) {
  return sync([&]() -> std::optional<VSAValue> {
    auto entry = _onQueue_entry(identifier, nullptr);
    if (!entry || entry->isPlaceholder() || entry->isAdvanceCopy() || entry->isInvalid())
      return std::nullopt;
    return entry->codeSigningInfo();
  });
}

VSAContainerClass VSACodeSigningMapping::dataContainerTypeForIdentifier(
    const std::string& identifier) {
  // Asked on every launch: only the class column is read.
  return sync([&]() -> VSAContainerClass {
    VSAErrorRef e;
    auto c = codeSigningMappingDB_->dataContainerClassWithIdentifier(identifier, &e);
    if (!c && e && !VSASQLiteDB::isNotFound(e))
      logMapping(kVSALogError, "Error retrieving entry from DB with identifier %@ : %@", identifier,
                 e);
    return c.value_or(VSAClass::kUndefined);
  });
}

bool VSACodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
  auto e = entitlementsForIdentifier(identifier);
  const VSAValue* v = e ? e->get(kVSAEntitlementSystemContainer) : nullptr;
  return v && v->boolValue().value_or(false);
}

bool VSACodeSigningMapping::identifierHasCallerRegisteredEntitlements(
    const std::string& identifier) {
  return sync([&] {
    auto entry = _onQueue_entry(identifier, nullptr);
    return entry && entry->isRegisteredByCaller();
  });
}
