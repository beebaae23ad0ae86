#include "model/VSAUserIdentity.h"

#include "base/VSALog.h"
#include "model/VSAUserIdentityCache.h"

VSAUserIdentity::VSAUserIdentity(uid_t uid, gid_t gid, std::string home,
                                 std::optional<std::string> unique, uint32_t personaType,
                                 int32_t kernelPersonaID)
    : home_(std::move(home)),
      kernelPersonaID_(kernelPersonaID),
      uid_(uid),
      gid_(gid),
      personaType_(personaType),
      uniqueString_(std::move(unique)),
      identifier_(identifierForPOSIXUID(uid, uniqueString_, personaType)) {}

VSAUserIdentityRef VSAUserIdentity::make(uid_t uid, gid_t gid, std::string homeDirectoryURL,
                                         std::optional<std::string> personaUniqueString,
                                         uint32_t personaType, int32_t kernelPersonaID) {
  if (uid < kVSAMinimumUserUID) {
    VSALog(kVSALogError, "initWithUID",
           "Attempt to create a VSAUserIdentity object with a role user uid is not allowed: uid = "
           "%u, gid = %u",
           uid, gid);
    return nullptr;
  }
  if (homeDirectoryURL.empty()) VSALog(kVSALogFault, "initWithUID", "Home directory cannot be nil");
  return std::make_shared<const VSAUserIdentity>(uid, gid, std::move(homeDirectoryURL),
                                                 std::move(personaUniqueString), personaType,
                                                 kernelPersonaID);
}

VSAUserIdentityRef VSAUserIdentity::bare() {
  return std::make_shared<const VSAUserIdentity>(0, 0, std::string(), std::nullopt, 0, 0);
}

std::string VSAUserIdentity::identifierForPOSIXUID(uid_t uid,
                                                   const std::optional<std::string>& unique,
                                                   uint32_t personaType) {
  if (personaType == kVSAPersonaTypeEnterprise && unique) return *unique;
  return std::to_string(uid);
}

uid_t VSAUserIdentity::posixUIDForContainerClass(VSAContainerClass c) const {
  if (VSAContainerClassIsBundle(c)) return CONTAINER_INSTALLATION_UID;
  if (VSAContainerClassIsSystem(c)) return CONTAINER_SYSTEM_UID;
  return uid_;
}

gid_t VSAUserIdentity::posixGIDForContainerClass(VSAContainerClass c) const {
  if (VSAContainerClassIsBundle(c)) return CONTAINER_INSTALLATION_UID;
  if (VSAContainerClassIsSystem(c)) return CONTAINER_SYSTEM_UID;
  return gid_;
}

bool VSAUserIdentity::isUserIdentityRequiredForContainerClass(VSAContainerClass c) {
  return !VSAContainerClassIsBundle(c) && !VSAContainerClassIsSystem(c);
}

VSAValue VSAUserIdentity::plist() const {
  VSAValue p = VSAValue::Dictionary{{"posixUID", VSAValue(static_cast<uint64_t>(uid_))},
                                    {"posixGID", VSAValue(static_cast<uint64_t>(gid_))},
                                    {"type", VSAValue(static_cast<uint64_t>(personaType_))},
                                    {"version", VSAValue("2")}};
  if (uniqueString_) p.set("personaUniqueString", VSAValue(*uniqueString_));
  return p;
}

const char* VSAUserIdentity::descriptionForPersonaType(uint32_t type) {
  switch (type) {
    case kVSAPersonaTypePersonal:
      return "personal";
    case kVSAPersonaTypeEnterprise:
      return "enterprise";
    case kVSAPersonaTypeUnspecific:
      return "unspecific";
    default:
      return "unknown";
  }
}

std::string VSAUserIdentity::shortDescription() const {
  return VSAFormat("<%@: %p; %u/%u/%@/%d/%d>", "VSAUserIdentity", static_cast<const void*>(this),
                   uid_, gid_, identifier_, personaType_, kernelPersonaID_);
}

std::string VSAUserIdentity::description() const {
  return VSAFormat(
      "<%@: %p; posixUID = %u, posixGID = %u, identifier = %@, homeDirectoryURL = %@, personaType "
      "= %@, personaUniqueString = %@, kernelPersonaID = %d>",
      "VSAUserIdentity", static_cast<const void*>(this), uid_, gid_, identifier_, home_,
      descriptionForPersonaType(personaType_),
      uniqueString_ ? *uniqueString_ : std::string("(null)"), kernelPersonaID_);
}

bool VSAUserIdentityEqual(const VSAUserIdentityRef& a, const VSAUserIdentityRef& b) {
  if (a == b) return true;
  if (!a || !b) return false;
  return a->isEqualToUserIdentity(*b);
}

namespace {
const char* typeName(const VSAValue* v) {
  if (!v) return "(null)";
  switch (v->type()) {
    case VSAValue::Type::String:
      return "NSString";
    case VSAValue::Type::Array:
      return "NSArray";
    case VSAValue::Type::Dictionary:
      return "NSDictionary";
    case VSAValue::Type::Data:
      return "NSData";
    default:
      return "NSNumber";
  }
}

// A 32-bit number field, or nothing after logging the plist error.
std::optional<uint32_t> numberField(const VSAValue& plist, const char* key) {
  const VSAValue* v = plist.get(key);
  if (!v || !v->isInteger() || !v->uint64Value() || *v->uint64Value() > UINT32_MAX) {
    VSALog(kVSALogError, "initWithPlist",
           "Invalid user identity plist data. Expected number for %@, got %@. Data: %@", key,
           typeName(v), plist);
    return std::nullopt;
  }
  return static_cast<uint32_t>(*v->uint64Value());
}

VSAUserIdentityRef failWith(VSAResultCode* error, VSAResultCode code) {
  VSASetCode(error, code);
  return nullptr;
}
}  // namespace

VSAUserIdentityRef VSAUserIdentity::userIdentityWithPlist(const VSAValue& plist,
                                                          VSAUserIdentityCache& cache,
                                                          VSAResultCode* error) {
  const VSAValue* version = plist.get("version");
  const std::string* v = version ? version->stringValue() : nullptr;
  if (!plist.isDictionary() || !v || (*v != "1" && *v != "2")) return bare();
  auto uid = numberField(plist, "posixUID");
  if (!uid) return failWith(error, VSAResult::kInvalidUserIdentityPlist);
  auto gid = numberField(plist, "posixGID");
  if (!gid) return failWith(error, VSAResult::kInvalidUserIdentityPlist);
  VSAUserIdentityRef result;
  if (*v == "1") {
    const VSAValue* persona = plist.get("personaIdentifier");
    if (persona && persona->isString())
      result = cache.userIdentityForPersonaUniqueString(*persona->stringValue(), *uid, *gid);
    if (!result) result = cache.userIdentityForPersonalPersonaWithUID(*uid, *gid);
    return result ? result : failWith(error, VSAResult::kSuccess);
  }
  auto type = numberField(plist, "type");
  if (!type) return failWith(error, VSAResult::kInvalidUserIdentityPlist);
  if (*type >= 3) {
    VSALog(kVSALogError, "initWithPlist",
           "Invalid user identity plist data. Expected persona type for %@, got %@. Data: %@",
           "type", *plist.get("type"), plist);
    return failWith(error, VSAResult::kInvalidUserIdentityPlist);
  }
  const VSAValue* unique = plist.get("personaUniqueString");
  if (*type == kVSAPersonaTypeEnterprise && unique && unique->isString()) {
    result = cache.userIdentityForPersonaUniqueString(*unique->stringValue(), *uid, *gid);
    if (!result) return failWith(error, VSAResult::kSuccess);
    if (!result->isEnterprise())
      VSALog(kVSALogError, "initWithPlist",
             "Invalid user identity plist data. Expected %@ to be enterprise, but it was not. "
             "Data: %@",
             result, plist);
    return result;
  }
  result = cache.userIdentityForPersonalPersonaWithUID(*uid, *gid);
  return result ? result : failWith(error, VSAResult::kSuccess);
}
