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

const std::map<uint64_t, std::vector<std::string>>& VSAContainerSubdirectories::builtIn() {
  static const std::map<uint64_t, std::vector<std::string>> table = {
      {1, {}},
      {2, {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}},
      {3, {}},
      {4, {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}},
      {5, {}},
      {6, {"Library", "Library/Caches", "tmp"}},
      {7, {"Library", "Library/Caches", "Library/Preferences"}},
      {8, {}},
      {9, {"Library", "Library/Caches", "tmp"}},
      {10, {"Library", "Library/Caches", "Library/Preferences", "tmp"}},
      {11, {"tmp"}},
      {12, {"Library", "Library/Caches", "tmp"}},
      {13, {"Library", "Library/Caches"}},
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
    if (key.empty() || *end != '\0' || c < 1 || c > 13 || !names) {
      VSALog(kVSALogError, "VSAContainerSubdirectories",
             "Ignoring invalid sub-directory entry %@ in %@", key, path);
      continue;
    }
    table_[c] = std::move(*names);
  }
}

std::optional<std::vector<std::string>> VSAContainerSubdirectories::subdirectoriesForClass(
    uint64_t containerClass, VSAResultCode* error) const {
  auto it = table_.find(containerClass);
  if (it == table_.end()) {
    VSASetCode(error, VSAResult::kInvalidClass);
    return std::nullopt;
  }
  return it->second;
}
