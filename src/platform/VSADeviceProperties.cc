#include "platform/VSADeviceProperties.h"

#include "base/VSALog.h"
#include "base/VSAPlist.h"

namespace {
VSAValue readOptional(const std::string& path) {
  VSAErrorRef error;
  auto dict = VSA_dictionaryWithContentsOfURL(path, 0, &error);
  if (dict) return *dict;
  if (error && !(error->domain() == kVSAPOSIXErrorDomain && error->code() == ENOENT))
    VSALog(kVSALogError, "VSADeviceProperties", "Ignoring unreadable %s: %@", path, error);
  return VSAValue::dictionary();
}
}  // namespace

VSADeviceProperties::VSADeviceProperties(const VSASystemRoot& root)
    : device_(readOptional(root.resolve("/etc/vessad/device.plist"))),
      features_(readOptional(root.resolve("/etc/vessad/features.plist"))) {}

bool VSADeviceProperties::flag(const VSAValue& dict, const std::string& key, bool defaultValue) {
  const VSAValue* v = dict.get(key);
  if (!v) return defaultValue;
  auto b = v->boolValue();
  return b ? *b : defaultValue;
}
