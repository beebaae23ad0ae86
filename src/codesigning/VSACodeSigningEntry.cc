#include "codesigning/VSACodeSigningEntry.h"

#include <functional>

#include "base/VSABinaryPlist.h"
#include "base/VSAFormat.h"

VSACodeSigningEntry::VSACodeSigningEntry(VSAValue codeSigningInfo,
                                         VSAContainerClass dataContainerClass)
    : info_(std::move(codeSigningInfo)), dataContainerClass_(dataContainerClass) {}

VSACodeSigningEntry VSACodeSigningEntry::initWithSerializedDictionary(const VSAValue& d) {
  const VSAValue* info = d.get("CodeSigningInfo");
  VSACodeSigningEntry e(
      info ? *info : VSAValue(),
      d.get("DataContainerClass")
          ? d.get("DataContainerClass")->uint64Value().value_or(VSAClass::kUndefined)
          : VSAClass::kUndefined);
  if (const VSAValue* children = d.get("ChildBundleIds"); children && children->isArray()) {
    std::vector<std::string> ids;
    for (const VSAValue& v : *children->arrayValue())
      if (v.isString()) ids.push_back(*v.stringValue());
    e.children_ = std::move(ids);
  }
  auto flag = [&](const char* key) {
    const VSAValue* v = d.get(key);
    return v && v->boolValue().value_or(false);
  };
  e.invalid_ = flag("Invalid");
  e.placeholder_ = flag("Placeholder");
  e.advanceCopy_ = flag("AdvanceCopy");
  e.registeredByCaller_ = flag("RegisteredByCaller");
  return e;
}

VSAValue VSACodeSigningEntry::serialize() const {
  VSAValue d = VSAValue::Dictionary{{"CodeSigningInfo", info_},
                                    {"Invalid", VSAValue(invalid_)},
                                    {"Placeholder", VSAValue(placeholder_)},
                                    {"AdvanceCopy", VSAValue(advanceCopy_)},
                                    {"RegisteredByCaller", VSAValue(registeredByCaller_)},
                                    {"DataContainerClass", VSAValue(dataContainerClass_)}};
  if (children_) {
    VSAValue::Array a;
    for (const auto& id : *children_) a.push_back(VSAValue(id));
    d.set("ChildBundleIds", VSAValue(std::move(a)));
  }
  return d;
}

bool VSACodeSigningEntry::isEqual(const VSACodeSigningEntry& o) const {
  return this == &o || (info_ == o.info_ && children_ == o.children_ && invalid_ == o.invalid_ &&
                        placeholder_ == o.placeholder_ && advanceCopy_ == o.advanceCopy_ &&
                        registeredByCaller_ == o.registeredByCaller_ &&
                        dataContainerClass_ == o.dataContainerClass_);
}

size_t VSACodeSigningEntry::hash() const {
  // Values hash through their canonical binary encoding.
  auto hashValue = [](const VSAValue& v) -> size_t {
    auto bytes = VSABinaryPlist::encode(v, VSABinaryPlist::UUIDForm::String, nullptr);
    return bytes ? std::hash<std::string>()(std::string(bytes->begin(), bytes->end())) : 0;
  };
  size_t childHash = 0;
  if (children_)
    for (const auto& id : *children_) childHash = childHash * 31 + std::hash<std::string>()(id);
  size_t h = hashValue(info_) ^ childHash;
  h += invalid_ ? 2 : 0;
  h += placeholder_ ? 4 : 0;
  h += registeredByCaller_ ? 8 : 0;
  h += dataContainerClass_ != VSAClass::kUndefined ? 16 : 0;
  h += advanceCopy_ ? 32 : 0;
  return h;
}

std::string VSACodeSigningEntry::description() const {
  std::string children = "(null)";
  if (children_) {
    children = "(";
    for (size_t i = 0; i < children_->size(); ++i) children += (i ? ", " : "") + (*children_)[i];
    children += ")";
  }
  auto yn = [](bool b) { return b ? 'Y' : 'N'; };
  return VSAFormat(
      "<%@ invalid: %c, placeholder: %c, advanceCopy: %c, regByCaller: %c, dataClass: %llu, "
      "childBundles: %@, CSinfo: %@>",
      "VSACodeSigningEntry", yn(invalid_), yn(placeholder_), yn(advanceCopy_),
      yn(registeredByCaller_), dataContainerClass_, children, info_);
}
