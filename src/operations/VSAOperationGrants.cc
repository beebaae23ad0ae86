#include "operations/VSAOperationGrants.h"

namespace {
// The lookup entitlement's key for each container class.
const char* const kLookupKeys[] = {nullptr,  "app",     "appData",    "plugin",     "pluginData",
                                   "vpn",    "vpnData", "appGroup",   "framework",  "relayService",
                                   "daemon", "tempDir", "systemData", "systemGroup"};
}  // namespace

std::optional<std::set<std::string>> VSAOperationGrants::lookupForContainerClass(
    VSAContainerClass c) const {
  if (!VSAContainerClassIsValid(c)) return std::nullopt;
  std::lock_guard lock(lookupCacheMutex_);
  if (!lookup) return std::nullopt;
  if (!lookupCache_) lookupCache_.emplace();
  const char* key = kLookupKeys[c];
  auto it = lookupCache_->find(key);
  if (it != lookupCache_->end()) return it->second;
  std::set<std::string> ids;
  const VSAValue* value = lookup->get(key);
  if (value && value->isArray())
    for (const auto& item : *value->arrayValue())
      if (item.isString()) ids.insert(*item.stringValue());
  return (*lookupCache_)[key] = std::move(ids);
}

bool VSAOperationGrants::isEntitledForLookupWithClass(VSAContainerClass c,
                                                      const std::string& identifier) const {
  auto ids = lookupForContainerClass(c);
  return ids && ids->count(identifier) > 0;
}

bool VSAOperationGrants::isEntitledToWipe(const std::string& identifier) const {
  if (!entitledWipeIdentifiers || !entitledWipeIdentifiers->isArray()) return false;
  for (const auto& item : *entitledWipeIdentifiers->arrayValue())
    if (item.isString() && *item.stringValue() == identifier) return true;
  return false;
}
