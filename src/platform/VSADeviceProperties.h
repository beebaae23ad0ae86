// Device properties, operating-system variant and feature flags of a root.
//
// Read from `<root>/etc/vessad/device.plist` and `features.plist`; a missing
// file or key takes the default. device.plist keys: "HasInternalContent"
// (bool, default NO: the internal-build query), "UsesEphemeralStorage"
// (bool, NO), "MultiUser" (bool, NO), "MultiUserFlags" (number: the host's
// multi-user configuration flags) and "PersonasDisabled" (bool, NO).
// features.plist is a dictionary of feature name -> bool. Read once at
// construction; immutable afterwards.
#pragma once

#include <string>

#include "base/VSAValue.h"
#include "platform/VSASystemRoot.h"

class VSADeviceProperties {
 public:
  explicit VSADeviceProperties(const VSASystemRoot& root);

  bool hasInternalContent() const { return flag(device_, "HasInternalContent", false); }
  bool usesEphemeralStorage() const { return flag(device_, "UsesEphemeralStorage", false); }
  bool isMultiUser() const { return flag(device_, "MultiUser", false); }
  // The multi-user configuration flags' top bit (bit 31): the device runs
  // in multi-user mode. False when the flags cannot be read.
  bool multiUserFlagsTopBitSet() const {
    const VSAValue* flags = device_.get("MultiUserFlags");
    auto value = flags ? flags->uint64Value() : std::nullopt;
    return value && (*value & 0x80000000u);
  }
  bool isFeatureEnabled(const std::string& name, bool defaultValue = false) const {
    return flag(features_, name, defaultValue);
  }
  const VSAValue& deviceDictionary() const { return device_; }

 private:
  static bool flag(const VSAValue& dict, const std::string& key, bool defaultValue);
  VSAValue device_ = VSAValue::dictionary();
  VSAValue features_ = VSAValue::dictionary();
};
