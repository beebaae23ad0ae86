#include "platform/VSAContainerSubdirectories.h"

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"

namespace {
bool validName(const std::string& name) {
  return !name.empty() && name.front() != '/' && !containsDotDotPathComponents(name);
}

std::optional<std::vector<std::string>> namesFrom(const VSAValue& value) {
  if (!value.isArray()) return std::nullopt;
  std::vector<std::string> names;
  for (const auto& item : *value.arrayValue()) {
    if (!item.isString() || !validName(*item.stringValue())) return std::nullopt;
    names.push_back(*item.stringValue());
  }
  return names;
}
}  // namespace

const std::map<VSAContainerClass, std::vector<std::string>>& VSAContainerSubdirectories::builtIn() {
  using namespace VSAClass;
  static const std::map<VSAContainerClass, std::vector<std::string>> table = {
      {kBundleApplication, {}},
      {kDataApplication,
       {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}},
      {kBundlePlugin, {}},
      {kDataPlugin,
       {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}},
      {kBundleVPNPlugin, {}},
      {kDataVPNPlugin, {"Library", "Library/Caches", "tmp"}},
      {kAppGroup, {"Library", "Library/Caches", "Library/Preferences"}},
      {kBundleFramework, {}},
      {kDataRelayService, {"Library", "Library/Caches", "tmp"}},
      {kDataInternalDaemon, {"Library", "Library/Caches", "Library/Preferences", "tmp"}},
      {kDataTempDir, {"tmp"}},
      {kSystemData, {"Library", "Library/Caches", "tmp"}},
      {kSystemGroup, {"Library", "Library/Caches"}},
  };
  return table;
}

VSAContainerSubdirectories::VSAContainerSubdirectories(const VSASystemRoot& root)
    : table_(builtIn()) {
  std::string path = root.resolve("/etc/vessad/subdirectories.plist");
  VSAErrorRef error;
  auto dict = VSA_dictionaryWithContentsOfURL(path, 0, &error);
  if (!dict) return;  // absent: the built-in table alone
  for (const auto& [key, value] : *dict->dictionaryValue()) {
    char* end = nullptr;
    unsigned long long c = std::strtoull(key.c_str(), &end, 10);
    auto names = namesFrom(value);
    if (key.empty() || *end != '\0' || c < kVSAContainerClassMin || c > kVSAContainerClassMax ||
        !names) {
      VSALog(kVSALogError, "VSAContainerSubdirectories",
             "Ignoring invalid sub-directory entry %@ in %@", key, path);
      continue;
    }
    table_[c] = std::move(*names);
  }
}

std::optional<std::vector<std::string>> VSAContainerSubdirectories::subdirectoriesForClass(
    VSAContainerClass containerClass, VSAResultCode* error) const {
  auto it = table_.find(containerClass);
  if (it == table_.end()) {
    VSASetCode(error, VSAResult::kInvalidClass);
    return std::nullopt;
  }
  return it->second;
}
