// One record of the code-signing mapping: the code-signing info dictionary
// of an identifier, its child (plug-in) identifiers, four flags and the class
// of its data container. A plain value: serialisation, equality, hash and
// description only.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "base/VSAValue.h"
#include "model/VSAContainerClass.h"

class VSACodeSigningEntry {
 public:
  // initWithCodeSigningInfo:andDataContainerClass:
  explicit VSACodeSigningEntry(VSAValue codeSigningInfo,
                               VSAContainerClass dataContainerClass = VSAClass::kUndefined);
  // initWithSerializedDictionary: (values are not type-checked; missing flags are false)
  static VSACodeSigningEntry initWithSerializedDictionary(const VSAValue& serialized);

  const VSAValue& codeSigningInfo() const { return info_; }
  void setCodeSigningInfo(VSAValue info) { info_ = std::move(info); }
  const std::optional<std::vector<std::string>>& childBundleIdentifiers() const {
    return children_;
  }
  void setChildBundleIdentifiers(std::optional<std::vector<std::string>> c) {
    children_ = std::move(c);
  }
  bool isInvalid() const { return invalid_; }
  void setInvalid(bool v) { invalid_ = v; }
  bool isPlaceholder() const { return placeholder_; }
  void setPlaceholder(bool v) { placeholder_ = v; }
  bool isAdvanceCopy() const { return advanceCopy_; }
  void setAdvanceCopy(bool v) { advanceCopy_ = v; }
  bool isRegisteredByCaller() const { return registeredByCaller_; }
  void setRegisteredByCaller(bool v) { registeredByCaller_ = v; }
  VSAContainerClass dataContainerClass() const { return dataContainerClass_; }
  void setDataContainerClass(VSAContainerClass c) { dataContainerClass_ = c; }

  VSAValue serialize() const;
  bool isEqual(const VSACodeSigningEntry& other) const;
  size_t hash() const;
  std::string description() const;

 private:
  VSAValue info_;
  std::optional<std::vector<std::string>> children_;
  bool invalid_ = false;
  bool placeholder_ = false;
  bool advanceCopy_ = false;
  bool registeredByCaller_ = false;
  VSAContainerClass dataContainerClass_ = VSAClass::kUndefined;
};
