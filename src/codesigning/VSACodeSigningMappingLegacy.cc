// The code-signing mapping's part of the legacy migrations: the legacy
// entitlements file and the entries other migrations add.
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "codesigning/VSACodeSigningMapping.h"

namespace {
constexpr const char* kLegacyEntitlementsFile = "vsa_entitlements.plist";
constexpr const char* kChildren = "com.tamsk.Vessa.ChildPluginBundleIDs";
constexpr const char* kRegisteredByCaller = "com.tamsk.Vessa.EntitlementsRegisteredByCaller";
constexpr const char* kPlaceholders = "com.tamsk.Vessa.PlaceholderEntitlements";

template <typename... A>
void logLegacy(int level, const char* origin, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::CodeSignMapping, level, origin, format, args...);
}

// The identifier's true boolean in a bookkeeping dictionary.
bool flagFor(const VSAValue* dict, const std::string& identifier) {
  const VSAValue* v = dict ? dict->get(identifier) : nullptr;
  return v && v->isBool() && v->boolValue().value_or(false);
}

std::optional<std::vector<std::string>> childrenFor(const VSAValue* dict,
                                                    const std::string& identifier) {
  const VSAValue* v = dict ? dict->get(identifier) : nullptr;
  const VSAValue::Array* array = v ? v->arrayValue() : nullptr;
  if (!array) return std::nullopt;
  std::vector<std::string> children;
  for (const VSAValue& child : *array)
    if (child.isString()) children.push_back(*child.stringValue());
  return children;
}
}  // namespace

bool VSACodeSigningMapping::addLegacyEntryUnlessValid(const std::string& identifier,
                                                      const VSACodeSigningEntry& entry, bool* kept,
                                                      VSAErrorRef* error,
                                                      const std::function<void()>& beforeWrite) {
  return sync([&] {
    return _onQueue_addLegacyEntryUnlessValid(identifier, entry, kept, error, beforeWrite);
  });
}

bool VSACodeSigningMapping::_onQueue_addLegacyEntryUnlessValid(
    const std::string& identifier, const VSACodeSigningEntry& entry, bool* kept, VSAErrorRef* error,
    const std::function<void()>& beforeWrite) {
  VSAErrorRef readError;
  auto current = _onQueue_entry(identifier, &readError);
  if (readError) {
    VSASetError(error, readError);
    return false;
  }
  *kept = current && !current->isInvalid();
  if (*kept) return true;
  if (beforeWrite) beforeWrite();
  return codeSigningMappingDB_->addCodeSigningEntry(&entry, &identifier, error);
}

bool VSACodeSigningMapping::migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
  return sync([&] { return _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile(); });
}

bool VSACodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
  const char* origin = "_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile";
  auto& fm = configuration_->fileManager();
  std::string path = VSAPathJoin(configuration_->libraryDirectory(), kLegacyEntitlementsFile);
  if (!fm.itemExistsAtURL(path)) return true;
  logLegacy(kVSALogNotice, origin, "Performing legacy entitlement migration");
  VSAErrorRef error;
  auto file = VSA_dictionaryWithContentsOfURL(path, 0, &error);
  if (!file) {
    logLegacy(kVSALogError, origin,
              "Entitlement File exists at %@, but we unexpectedly cant read it", path);
    return false;
  }
  VSAValue children = file->get(kChildren) ? *file->get(kChildren) : VSAValue();
  VSAValue byCaller = file->get(kRegisteredByCaller) ? *file->get(kRegisteredByCaller) : VSAValue();
  VSAValue placeholders = file->get(kPlaceholders) ? *file->get(kPlaceholders) : VSAValue();
  bool everyIdentifierStored = true;
  for (const auto& [identifier, entitlements] : *file->dictionaryValue()) {
    if (identifier == kChildren || identifier == kRegisteredByCaller || identifier == kPlaceholders)
      continue;
    VSACodeSigningEntry entry(VSAValue::Dictionary{{kVSAEntitlementsKey, entitlements}},
                              VSAClass::kUndefined);
    entry.setChildBundleIdentifiers(childrenFor(&children, identifier));
    entry.setPlaceholder(flagFor(&placeholders, identifier));
    entry.setRegisteredByCaller(flagFor(&byCaller, identifier));
    bool kept = false;
    VSAErrorRef addError;
    // A named copy for the lambda: clang 14 cannot capture a structured binding.
    const std::string& migrating = identifier;
    if (!_onQueue_addLegacyEntryUnlessValid(identifier, entry, &kept, &addError, [&] {
          logLegacy(kVSALogNotice, origin, "Migrating legacy entitlements for %@", migrating);
        })) {
      logLegacy(kVSALogError, origin, "Failed to write migrated legacy info to DB for %@ : %@",
                identifier, addError);
      everyIdentifierStored = false;
    } else if (kept) {
      logLegacy(kVSALogNotice, origin,
                "Already have code signing info for %@.  No need to migrate legacy entitlements.",
                identifier);
    }
  }
  // A file whose identifiers are not all stored stays for the next run.
  if (!everyIdentifierStored) return false;
  VSAErrorRef removeError;
  if (!fm.removeFileAtURL(path, &removeError)) {
    logLegacy(kVSALogError, origin, "Failed to remove legacy file at %@: %@", path, removeError);
    return false;
  }
  logLegacy(kVSALogNotice, origin, "Legacy entitlement migration completed");
  return true;
}
