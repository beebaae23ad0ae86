#include "codesigning/VSAWhitelist.h"

#include <cstdlib>

#include "base/VSALog.h"
#include "base/VSAPlist.h"

namespace {
std::set<std::string> stringSet(const VSAValue* v) {
  std::set<std::string> out;
  if (v && v->isArray())
    for (const VSAValue& e : *v->arrayValue())
      if (e.isString()) out.insert(*e.stringValue());
  return out;
}

std::optional<VSAContainerClass> classKey(const std::string& key) {
  if (key.empty() || key.find_first_not_of("0123456789") != std::string::npos || key.size() > 3)
    return std::nullopt;
  return static_cast<VSAContainerClass>(std::strtoul(key.c_str(), nullptr, 10));
}

bool isAny(const VSAValue& v) {
  return v.isString() && *v.stringValue() == VSAWhitelist::kAnyMarker;
}
}  // namespace

VSAWhitelist::VSAWhitelist(const VSAValue& systemContainers, const VSAValue& systemGroupContainers,
                           const VSAValue& whitelistedContainers, const VSAValue& clients)
    : system_(stringSet(&systemContainers)), systemGroups_(stringSet(&systemGroupContainers)) {
  if (const auto* d = whitelistedContainers.dictionaryValue()) {
    for (const auto& [key, list] : *d)
      if (auto c = classKey(key); c && *c <= kVSAContainerClassMax)
        perClass_[*c] = stringSet(&list);
  }
  // Arrays become sets, through the nested dictionaries.
  if (const auto* d = clients.dictionaryValue()) {
    for (const auto& [client, value] : *d) {
      if (isAny(value)) {
        clients_[client] = std::nullopt;
        continue;
      }
      std::map<VSAContainerClass, IdentifierSet> classes;
      if (const auto* byClass = value.dictionaryValue()) {
        for (const auto& [key, ids] : *byClass) {
          auto c = classKey(key);
          if (!c) continue;
          classes[*c] = isAny(ids) ? IdentifierSet() : IdentifierSet(stringSet(&ids));
        }
      }
      clients_[client] = std::move(classes);
    }
  }
}

VSAValue VSAWhitelist::builtInTables() {
  auto list = [](std::initializer_list<const char*> ids) {
    VSAValue::Array a;
    for (const char* id : ids) a.push_back(VSAValue(id));
    return VSAValue(std::move(a));
  };
  return VSAValue::Dictionary{
      {"SystemContainers", list({"com.tamsk.lockdownd", "com.tamsk.mobile.installd.data"})},
      {"SystemGroupContainers",
       list({"systemgroup.com.tamsk.configurationprofiles", "systemgroup.com.tamsk.launcher",
             "systemgroup.com.tamsk.mobileactivation", "systemgroup.com.tamsk.sharedpc",
             "systemgroup.com.tamsk.nfcd", "systemgroup.com.tamsk.installd",
             "systemgroup.com.tamsk.security", "systemgroup.com.tamsk.personaservice"})},
      {"InternalSystemGroupContainers", list({"systemgroup.com.tamsk.internal.tools"})},
      {"ClassLookup", VSAValue::Dictionary{{std::to_string(VSAClass::kDataInternalDaemon),
                                            list({"com.tamsk.diagnosticd"})}}},
      {"Clients",
       VSAValue::Dictionary{
           {"com.tamsk.backupd", VSAValue(kAnyMarker)},
           {"com.tamsk.mobile.installd", VSAValue(kAnyMarker)},
           {"com.tamsk.launcher", VSAValue(kAnyMarker)},
           {"com.tamsk.diagnosticd", VSAValue(kAnyMarker)},
           {"com.tamsk.migrationd", VSAValue(kAnyMarker)},
           {"com.tamsk.homescreen", VSAValue::Dictionary{{"7", list({"group.com.tamsk.widgets"})}}},
           {"com.tamsk.mail.composer", VSAValue::Dictionary{{"2", list({"com.tamsk.mail"})}}},
           {"com.tamsk.photos.picker", VSAValue::Dictionary{{"2", list({"com.tamsk.photos"})}}},
           {"com.tamsk.keyboard.settings",
            VSAValue::Dictionary{{"7", list({"group.com.tamsk.keyboard"})}}},
       }},
  };
}

std::shared_ptr<VSAWhitelist> VSAWhitelist::load(const std::string& configPath,
                                                 bool internalBuild) {
  VSAValue tables = builtInTables();
  VSAErrorRef error;
  if (auto file = VSA_dictionaryWithContentsOfURL(configPath, 0, &error)) {
    tables = *file;
  } else if (error && !(error->domain() == kVSAPOSIXErrorDomain && error->code() == ENOENT)) {
    VSALog(kVSALogError, "VSAWhitelist",
           "Ignoring unreadable whitelist %s, using the built-in one: %@", configPath, error);
  }
  auto get = [&](const char* key) {
    const VSAValue* v = tables.get(key);
    return v ? *v : VSAValue();
  };
  VSAValue groups = get("SystemGroupContainers");
  if (internalBuild && groups.isArray()) {
    const VSAValue* extra = tables.get("InternalSystemGroupContainers");
    if (extra && extra->isArray())
      for (const VSAValue& v : *extra->arrayValue()) groups.append(v);
  }
  return std::make_shared<VSAWhitelist>(get("SystemContainers"), groups, get("ClassLookup"),
                                        get("Clients"));
}

bool VSAWhitelist::isLookupWhitelistedFromCodeSignIdentifier(const std::string& client,
                                                             VSAContainerClass c,
                                                             const std::string& id) const {
  if (c > kVSAContainerClassMax) return false;
  if (auto it = perClass_.find(c); it != perClass_.end() && it->second.count(id)) return true;
  auto entry = clients_.find(client);
  if (entry == clients_.end()) return false;
  if (!entry->second) return true;  // any container of any class
  auto byClass = entry->second->find(c);
  if (byClass == entry->second->end()) return false;
  return !byClass->second || byClass->second->count(id) > 0;
}

std::optional<std::string> VSAWhitelist::wellknownContainerForId(const std::string& id,
                                                                 VSAContainerClass c) const {
  if (c == VSAClass::kSystemData && systemContainerIdIsWellknown(id)) return id;
  if (c == VSAClass::kSystemGroup && systemGroupContainerIdIsWellknown(id)) return id;
  return std::nullopt;
}
