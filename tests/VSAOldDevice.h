// Lays out a system root as an earlier release left it, for the upgrade
// tests: a legacy entitlements file, marker files, code-signing info cached
// in a bundle container's metadata, group identifiers in a data container's
// metadata, old log files, the old bundle location, and a system version of
// an older build. Containers are made through the real creation path and
// their legacy info values written through the metadata file.
#pragma once

#include <filesystem>
#include <fstream>
#include <string>

#include "base/VSAPlist.h"
#include "daemon/VSAClientConnection.h"

struct VSAOldDevice {
  static constexpr const char* kCached = "com.example.cached";    // info in its bundle
  static constexpr const char* kGrouped = "com.example.grouped";  // group ids in its data
  static constexpr const char* kLegacy = "com.example.legacy";    // legacy entitlements file
  static constexpr const char* kKept = "com.example.kept";        // has a valid entry already
  static constexpr const char* kPlaceholder = "com.example.placeholder";
  static constexpr const char* kGroup = "group.com.example.shared";

  static void writeSystemVersion(const std::string& root, const std::string& build,
                                 const std::string& release = "User") {
    std::filesystem::create_directories(root + "/etc/vessad");
    VSAValue version =
        VSAValue::Dictionary{{"BuildVersion", VSAValue(build)}, {"ReleaseType", VSAValue(release)}};
    VSA_writeToURL(version, root + "/etc/vessad/system-version.plist", 0, nullptr);
  }

  static VSAValue strings(std::initializer_list<const char*> ids) {
    VSAValue::Array a;
    for (const char* id : ids) a.push_back(VSAValue(id));
    return VSAValue(std::move(a));
  }

  // `installer` is an unrestricted connection of the context on `root`.
  static void build(VSADaemonContext& context, VSAClientConnection& installer,
                    const VSAUserIdentityRef& user) {
    const std::string& root = context.systemRoot.resolve("/");
    std::string library = context.globalConfiguration->libraryDirectory();
    auto make = [&](const char* id, VSAContainerClass c) {
      VSAResultCode code = VSAResult::kSuccess;
      auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(user, id, c, nullptr);
      auto m = installer.createOrLookupContainerWithContainerIdentity(
          identity, {.createIfNecessary = true}, &code);
      std::ofstream(m->url() + "/keep.txt") << id;  // content that must survive
      return identity;
    };
    auto setInfo = [&](const VSAContainerIdentityRef& identity, const char* key, VSAValue value) {
      VSAResultCode code = VSAResult::kSuccess;
      VSAValue k(key);
      installer.setInfoValue(&value, &k, identity, true, &code);
    };
    setInfo(make(kCached, VSAClass::kBundleApplication), "com.tamsk.Ferrox.CachedCodeSigningInfo",
            VSAValue::Dictionary{
                {"Entitlements", VSAValue::Dictionary{{"com.tamsk.security.application-groups",
                                                       strings({kGroup})}}},
                {"SignerType", VSAValue("developer")}});
    make(kCached, VSAClass::kDataApplication);
    setInfo(make(kGrouped, VSAClass::kDataApplication), "com.tamsk.Ferrox.GroupContainerIDs",
            strings({kGroup}));
    make(kGroup, VSAClass::kAppGroup);
    VSAValue legacy = VSAValue::Dictionary{
        {kLegacy,
         VSAValue::Dictionary{{"com.tamsk.security.application-groups", strings({kGroup})}}},
        {kKept, VSAValue::Dictionary{{"legacy", VSAValue(true)}}},
        {kPlaceholder, VSAValue::Dictionary{{"placeholder", VSAValue(true)}}},
        {"com.tamsk.Vessa.ChildPluginBundleIDs",
         VSAValue::Dictionary{{kLegacy, strings({"com.example.legacy.widget"})}}},
        {"com.tamsk.Vessa.PlaceholderEntitlements",
         VSAValue::Dictionary{{kPlaceholder, VSAValue(true)}}},
        {"com.tamsk.Vessa.EntitlementsRegisteredByCaller", VSAValue::dictionary()}};
    VSA_writeToURL(legacy, library + "/vsa_entitlements.plist", 0, nullptr);
    VSA_writeToURL(VSAValue::Dictionary{{"VSAMigrationVersionNumber", VSAValue("OLD1")}},
                   library + "/vsa_bundle_migration_complete.plist", 0, nullptr);
    std::string logs = root + "/private/var/mobile/Library/Logs/Vessa";
    std::filesystem::create_directories(logs);
    for (const char* name : {"vessad.log", "vessad.log.1", "vessad.log.7", "notes.txt"})
      std::ofstream(logs + "/" + name) << name;
    std::string oldBundle = root + "/private/var/mobile/Containers/Bundle/Application/OLD-APP";
    std::filesystem::create_directories(oldBundle);
    std::ofstream(oldBundle + "/Info.plist") << "old app";
    writeSystemVersion(root, "OLD1");
  }
};
