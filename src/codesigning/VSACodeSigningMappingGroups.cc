// Group identifiers, reference counts and the database pass-throughs of
// VSACodeSigningMapping (registration lives in VSACodeSigningMapping.cc).
#include <algorithm>
#include <set>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSACommandStageForDelete.h"

namespace {
constexpr const char* kOrigin = "VSACodeSigningMapping";

template <typename... A>
void logMapping(int level, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::CodeSignMapping, level, kOrigin, format, args...);
}
}  // namespace

std::optional<std::vector<std::string>>
VSACodeSigningMapping::copyApplicationGroupEntitlementForIdentifier(const std::string& identifier,
                                                                    const VSAValue* entitlements,
                                                                    const char* groupKey) {
  const VSAValue* v = entitlements ? entitlements->get(groupKey) : nullptr;
  if (!v) return std::nullopt;
  std::set<std::string> ids;
  if (v->isString()) {
    ids.insert(*v->stringValue());
  } else if (v->isArray()) {
    for (const VSAValue& e : *v->arrayValue()) {
      if (!e.isString()) {
        logMapping(kVSALogError, "Entitlement %@ for %@ contains non-string values; ignoring.",
                   groupKey, identifier);
        return std::nullopt;
      }
      ids.insert(*e.stringValue());
    }
  } else {
    logMapping(kVSALogError, "Entitlement %@ for %@ does not contain supported types; ignoring.",
               groupKey, identifier);
    return std::nullopt;
  }
  return std::vector<std::string>(ids.begin(), ids.end());
}

std::optional<std::vector<std::string>> VSACodeSigningMapping::systemGroupIds(
    const std::string& identifier, const VSAValue* entitlements, bool filterPrefix) {
  auto ids = copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                          kVSAEntitlementSystemGroups);
  if (!ids || ids->empty())
    ids = copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                       kVSAEntitlementSystemGroupContainers);
  if (!ids || !filterPrefix) return ids;
  std::vector<std::string> kept;
  for (const auto& id : *ids) {
    if (id.rfind("systemgroup.", 0) == 0) {
      kept.push_back(id);
    } else {
      logMapping(kVSALogError, "System group ID %@ does not have proper prefix, ignoring.", id);
    }
  }
  return kept;
}

std::optional<std::vector<std::string>> VSACodeSigningMapping::appGroupIdentifiersForIdentifier(
    const std::string& id) {
  auto e = entitlementsForIdentifier(id);
  return copyApplicationGroupEntitlementForIdentifier(id, e ? &*e : nullptr,
                                                      kVSAEntitlementApplicationGroups);
}

std::optional<std::vector<std::string>> VSACodeSigningMapping::systemGroupIdentifiersForIdentifier(
    const std::string& id) {
  auto e = entitlementsForIdentifier(id);
  return systemGroupIds(id, e ? &*e : nullptr, true);
}

bool VSACodeSigningMapping::_onQueue_iterateGroupIdsWithKey(
    const char* key, const char* fallBackKey,
    const std::function<void(const std::string&, const std::optional<std::vector<std::string>>&)>&
        block) {
  VSACheckOnQueue(*queue_, __func__);
  VSAErrorRef error = codeSigningMappingDB_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& identifier, const VSACodeSigningEntry& entry) {
        const VSAValue* e = entry.codeSigningInfo().get(kVSAEntitlementsKey);
        auto ids = copyApplicationGroupEntitlementForIdentifier(identifier, e, key);
        if (fallBackKey && (!ids || ids->empty()))
          ids = copyApplicationGroupEntitlementForIdentifier(identifier, e, fallBackKey);
        block(identifier, ids);
      });
  if (!error) return true;
  logMapping(kVSALogError, "Failed to enumerate code signing info: %@", error);
  return false;
}

std::optional<VSAReferenceCounts> VSACodeSigningMapping::_onQueue_copyReferenceCountSetOfType(
    int type) {
  const char* key =
      type == kVSAGroupTypeSystem ? kVSAEntitlementSystemGroups : kVSAEntitlementApplicationGroups;
  const char* fallback =
      type == kVSAGroupTypeSystem ? kVSAEntitlementSystemGroupContainers : nullptr;
  VSAReferenceCounts counts;
  bool ok = _onQueue_iterateGroupIdsWithKey(
      key, fallback,
      [&](const std::string& identifier, const std::optional<std::vector<std::string>>& ids) {
        if (!ids) return;
        std::string list;
        for (const auto& id : *ids) {
          ++counts[id];
          list += (list.empty() ? "" : ", ") + id;
        }
        logMapping(kVSALogDebug, "Entitlements for identifier %@ references container IDs: %@",
                   identifier, "(" + list + ")");
      });
  if (!ok) return std::nullopt;
  return counts;
}

std::optional<VSAReferenceCounts> VSACodeSigningMapping::copyReferenceCountSetOfType(
    int groupType) {
  return sync([&] { return _onQueue_copyReferenceCountSetOfType(groupType); });
}

void VSACodeSigningMapping::_onQueue_handleChangeFromOldGroupContainerIds(
    const std::optional<std::vector<std::string>>& oldIds,
    const std::optional<std::vector<std::string>>& newIds, int groupType,
    VSACommandQueue* commandQueue) {
  if ((!oldIds && !newIds) || oldIds == newIds) return;
  std::vector<std::string> removed = oldIds.value_or(std::vector<std::string>{});
  for (const auto& id : newIds.value_or(std::vector<std::string>{}))
    removed.erase(std::remove(removed.begin(), removed.end(), id), removed.end());
  _onQueue_removeReferenceForGroupIdentifiers(removed, groupType, commandQueue);
}

void VSACodeSigningMapping::_onQueue_removeReferenceForGroupIdentifiers(
    const std::vector<std::string>& ids, int groupType, VSACommandQueue* commandQueue) {
  if (ids.empty()) return;
  auto counts = _onQueue_copyReferenceCountSetOfType(groupType);
  if (!counts) {
    logMapping(kVSALogError, "Failed to get reference count information for group type: %ld",
               static_cast<long>(groupType));
    return;
  }
  if (groupType == kVSAGroupTypeSystem) {
    std::string list;
    for (const auto& id : ids) list += id + " ";
    logMapping(kVSALogNotice, "Would have removed system group container references for %@", list);
    return;
  }
  userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const VSAUserIdentityRef& user) {
        auto perUser = configuration_->getPerUserConfigurationForUserIdentity(user);
        if (perUser && perUser->existsUserBaseDirectory())
          _onQueue_removeGroupContainersIfNeededforUserIdentity(user, VSAClass::kAppGroup, ids,
                                                                *counts, commandQueue);
      });
}

void VSACodeSigningMapping::_onQueue_removeGroupContainersIfNeededforUserIdentity(
    const VSAUserIdentityRef& user, VSAContainerClass groupContainerClass,
    const std::vector<std::string>& ids, VSAReferenceCounts counts, VSACommandQueue* commandQueue) {
  for (const auto& id : ids) {
    int& count = counts[id];
    if (count == 1) {
      logMapping(kVSALogNotice,
                 "Reference count for user: %@, ID: %@ is 1: removing its group container", user,
                 id);
      VSAResultCode code = VSAResult::kSuccess;
      auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(
          user, id, groupContainerClass, &code);
      if (identity && commandQueue) {
        std::string who = user->identifier();
        commandQueue->insertCommand(
            VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
                stageEnvironment_, {identity}, true, [id, who](VSAResultCode c) {
                  logMapping(kVSALogError,
                             "Failed to destroy group container with identifier %@ for %@: %llu",
                             id, who, c);
                }));
      }
    } else {
      logMapping(kVSALogNotice, "Reference count for user: %@, ID: %@ is %ld", user, id,
                 static_cast<long>(count));
    }
    if (count > 0) --count;
  }
}

std::optional<VSACodeSigningEntry> VSACodeSigningMapping::codeSigningEntryForIdentifier(
    const std::string& identifier, VSAErrorRef* error) {
  return sync(
      [&] { return codeSigningMappingDB_->codeSigningEntryWithIdentifier(identifier, error); });
}

std::optional<std::string> VSACodeSigningMapping::parentIdentifierForChildIdentifier(
    const std::string& child) {
  return sync(
      [&] { return codeSigningMappingDB_->parentIdentifierForChildIdentifier(child, nullptr); });
}

std::optional<std::vector<std::string>>
VSACodeSigningMapping::childBundleIdentifiersForParentIdentifier(const std::string& parent) {
  return sync(
      [&] { return codeSigningMappingDB_->childIdentifiersForParentIdentifier(parent, nullptr); });
}

std::optional<std::vector<std::string>> VSACodeSigningMapping::identifiersWithError(
    VSAErrorRef* error) {
  return sync([&] { return codeSigningMappingDB_->identifiersWithError(error); });
}

bool VSACodeSigningMapping::invalidateCodeSigningInfoForIdentifier(const std::string& identifier,
                                                                   VSAErrorRef* error) {
  return sync([&] {
    return codeSigningMappingDB_->invalidateCodeSigningWithIdentifier(identifier, error);
  });
}

bool VSACodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(
    const std::string& identifier, VSAErrorRef* error) {
  return sync([&] {
    return codeSigningMappingDB_->invalidateCodeSigningForIdentifierAndAllChildren(identifier,
                                                                                   error);
  });
}

void VSACodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier, VSACommandQueue* commandQueue) {
  auto children =
      childBundleIdentifiersForParentIdentifier(identifier).value_or(std::vector<std::string>{});
  children.push_back(identifier);
  for (const auto& id : children) {
    VSAResultCode code =
        processCodeSigningInfo(std::nullopt, &id, VSAValue::dictionary(), commandQueue);
    if (code != VSAResult::kSuccess)
      logMapping(kVSALogError, "Failed to clear entitlements for %@ : %llu", id, code);
  }
}

bool VSACodeSigningMapping::removeAllAdvanceCopiesWithError(VSAErrorRef* error) {
  return sync([&] {
    return codeSigningMappingDB_->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(error);
  });
}

VSAResultCode VSACodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  VSAAllIdentifiersLockGuard lock(*locks_, true);
  VSAResultCode result = VSAResult::kSuccess;
  VSAErrorRef error;
  auto identifiers = identifiersWithError(&error);
  if (!identifiers) {
    logMapping(kVSALogError,
               "Failed to enumerate containers when invalidating code signing info: %@", error);
    return error ? error->resultCode(VSAResult::kDatabaseFailed) : VSAResult::kDatabaseFailed;
  }
  auto owner = userIdentityCache_->defaultUserIdentity();
  for (const std::string& identifier : *identifiers) {
    VSAErrorRef entryError;
    auto entry = codeSigningEntryForIdentifier(identifier, &entryError);
    if (!entry) {
      logMapping(kVSALogError, "Error fetching code sign info for %@ to check for invalidation: %@",
                 identifier, entryError);
      continue;
    }
    VSAContainerClass c = entry->dataContainerClass();
    bool plugIn = c == VSAClass::kBundlePlugin || c == VSAClass::kDataPlugin ||
                  c == VSAClass::kBundleVPNPlugin || c == VSAClass::kDataVPNPlugin;
    bool hasParent = plugIn && parentIdentifierForChildIdentifier(identifier).has_value();
    logMapping(kVSALogInfo,
               "Checking for invalidation: identifier = %@, codeSigningEntry = <%p>, "
               "isRegisteredByCaller = %d, isPlugIn = %d, hasParent = %d",
               identifier, static_cast<const void*>(&*entry), entry->isRegisteredByCaller(), plugIn,
               hasParent);
    if (entry->isRegisteredByCaller() || hasParent) continue;
    bool found = false;
    for (VSAContainerClass bundle :
         {VSAClass::kBundleApplication, VSAClass::kBundlePlugin, VSAClass::kBundleVPNPlugin}) {
      auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(owner, identifier,
                                                                              bundle, nullptr);
      if (identity && stageEnvironment_ &&
          stageEnvironment_->cache->containerForContainerIdentity(*identity, {}, nullptr)) {
        found = true;
        break;
      }
    }
    if (found) continue;
    logMapping(kVSALogNotice, "Invalidating: identifier = %@, isPlugin = %d", identifier, plugIn);
    VSAErrorRef invalidateError;
    if (!invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier, &invalidateError)) {
      logMapping(kVSALogError, "Failed to invalidate code signing info for %@ : %@", identifier,
                 invalidateError);
      result = invalidateError ? invalidateError->resultCode(VSAResult::kDatabaseFailed)
                               : VSAResult::kDatabaseFailed;
    }
  }
  return result;
}

void VSACodeSigningMapping::reconcileSystemContainersWithCommandQueue(
    VSACommandQueue* commandQueue) {
  std::set<std::string> claimed;
  VSAErrorRef error = sync([&] {
    return codeSigningMappingDB_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const VSACodeSigningEntry& entry) {
          const VSAValue* e = entry.codeSigningInfo().get(kVSAEntitlementsKey);
          const VSAValue* v = e ? e->get(kVSAEntitlementSystemContainer) : nullptr;
          if (v && v->boolValue().value_or(false)) claimed.insert(identifier);
        });
  });
  if (error) {
    logMapping(kVSALogError, "Failed to enumerate system container references: %@", error);
    return;
  }
  if (!stageEnvironment_) return;
  VSAErrorRef listError;
  auto containers = stageEnvironment_->cache->allContainersForUserIdentity(
      userIdentityCache_->defaultUserIdentity(), VSAClass::kSystemData, {}, &listError);
  if (!containers) {
    logMapping(kVSALogError, "Failed to fetch system container list: %@", listError);
    return;
  }
  for (const auto& m : *containers) {
    if (claimed.count(m->identifier())) continue;
    logMapping(kVSALogNotice, "Removing system container with identifier %@", m->identifier());
    if (commandQueue)
      commandQueue->insertCommand(
          VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
              stageEnvironment_, {m->containerIdentity()}, false, nullptr));
  }
}
