#include "dataprotection/VSADataProtectionUpdateFile.h"

#include "base/VSAFormat.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"

namespace {
const char* const kOrigin = "_readAndValidateDataProtectionUpdateAtURL";

VSAErrorRef invalid(const char* what, const VSAValue* value, const std::string& url) {
  auto e = VSA_ERROR(VSAResult::kInvalidUpdateFile, "Invalid update info %s: %@ at %@", what,
                     value ? value->description() : std::string("(null)"), url);
  VSALog(kVSALogError, kOrigin, "%@", e->message());
  return e;
}

VSAUserIdentityRef userIdentityFromUpdate(const VSAValue& dict, VSAContainerClass containerClass,
                                          VSAUserIdentityCache& cache) {
  if (const VSAValue* plist = dict.get(kVSADataOperationUserIdentityKey)) {
    VSAResultCode code = VSAResult::kSuccess;
    return VSAUserIdentity::userIdentityWithPlist(*plist, cache, &code);
  }
  if (const VSAValue* uid = dict.get(kVSADataOperationUserIdKey)) {
    auto value = uid->isInteger() ? uid->uint64Value() : std::nullopt;
    if (!value) return nullptr;
    VSAUserIdentityRef fallback = cache.defaultUserIdentity();
    if (fallback && fallback->posixUID() == *value) return fallback;
    return cache.userIdentityForPersonalPersonaWithUID(static_cast<uid_t>(*value),
                                                       static_cast<gid_t>(*value));
  }
  // Classes without a user identity belong to the default one.
  if (!VSAUserIdentity::isUserIdentityRequiredForContainerClass(containerClass))
    return cache.defaultUserIdentity();
  return nullptr;
}
}  // namespace

VSAValue VSADataProtectionUpdate::plist() const {
  VSAValue dict = VSAValue::dictionary();
  dict.set(kVSADataOperationIdentifierKey, identifier);
  dict.set(kVSADataOperationContainerClassKey, static_cast<uint64_t>(containerClass));
  dict.set(kVSADataOperationProtectionClassKey, static_cast<int64_t>(protectionClass));
  dict.set(kVSADataOperationChangeTypeKey, static_cast<uint64_t>(changeType));
  dict.set(kVSADataOperationRetryIfLockedKey, retryIfLocked);
  dict.set(kVSADataOperationInternalIDKey, internalID.string());
  if (userIdentity && VSAUserIdentity::isUserIdentityRequiredForContainerClass(containerClass))
    dict.set(kVSADataOperationUserIdentityKey, userIdentity->plist());
  return dict;
}

std::optional<VSADataProtectionUpdate>
VSADataProtectionUpdate::_readAndValidateDataProtectionUpdateAtURL(const std::string& url,
                                                                   VSAUserIdentityCache& cache,
                                                                   VSAErrorRef* error) {
  if (url.empty()) {
    VSASetError(error, VSA_ERROR(VSAResult::kInvalidUpdateFile, "URL cannot be nil"));
    return std::nullopt;
  }
  VSAErrorRef underlying;
  auto dict = VSA_dictionaryWithContentsOfURL(url, kVSAReadBinaryPropertyListOnly, &underlying,
                                              kVSADataProtectionUpdateFileMaxSize);
  if (!dict) {
    auto e = VSA_ERROR_UNDERLYING(VSAResult::kInvalidUpdateFile, underlying,
                                  "Failed to read update info at URL %@", url);
    VSALog(kVSALogError, kOrigin, "%@", e->message());
    VSASetError(error, e);
    return std::nullopt;
  }
  VSADataProtectionUpdate update;
  const VSAValue* v = dict->get(kVSADataOperationIdentifierKey);
  if (!v || !v->isString() || v->stringValue()->empty()) {
    VSASetError(error, invalid("Identifier", v, url));
    return std::nullopt;
  }
  update.identifier = *v->stringValue();
  v = dict->get(kVSADataOperationContainerClassKey);
  auto cls = v && v->isInteger() ? v->uint64Value() : std::nullopt;
  if (!cls || !VSAContainerClassIsValid(*cls)) {
    VSASetError(error, invalid("ContainerClass", v, url));
    return std::nullopt;
  }
  update.containerClass = *cls;
  v = dict->get(kVSADataOperationProtectionClassKey);
  auto protection = v && v->isInteger() ? v->int64Value() : std::nullopt;
  if (!protection || *protection < 0 || *protection > INT32_MAX) {
    VSASetError(error, invalid("ProtectionClass", v, url));
    return std::nullopt;
  }
  update.protectionClass = static_cast<int32_t>(*protection);
  v = dict->get(kVSADataOperationRetryIfLockedKey);
  if (!v || !v->isBool()) {
    VSASetError(error, invalid("RetryIfLocked", v, url));
    return std::nullopt;
  }
  update.retryIfLocked = *v->boolValue();
  v = dict->get(kVSADataOperationChangeTypeKey);
  auto changeType = v && v->isInteger() ? v->uint64Value() : std::nullopt;
  if (!changeType || *changeType > UINT32_MAX) {
    VSASetError(error, invalid("ChangeType", v, url));
    return std::nullopt;
  }
  update.changeType = static_cast<uint32_t>(*changeType);
  v = dict->get(kVSADataOperationInternalIDKey);
  auto internalID = v && v->isString() ? VSAUUID::parse(*v->stringValue()) : std::nullopt;
  if (!internalID) {
    VSASetError(error, invalid("InternalID", v, url));
    return std::nullopt;
  }
  update.internalID = *internalID;
  update.userIdentity = userIdentityFromUpdate(*dict, update.containerClass, cache);
  if (!update.userIdentity) {
    auto e = VSA_ERROR(VSAResult::kInvalidUpdateFile, "Could not create user identity.");
    VSALog(kVSALogError, kOrigin, "%@", e->message());
    VSASetError(error, e);
    return std::nullopt;
  }
  return update;
}

bool VSAWriteDataProtectionUpdate(const VSADataProtectionUpdate& update, const std::string& url,
                                  VSAFileManager& fm, int protectionClass, mode_t mode,
                                  VSAErrorRef* error) {
  std::string directory = VSADirectoryName(url);
  // Made durably: the update file committed into it must survive a power loss.
  if (!fm.itemExistsAtURL(directory) &&
      !fm.createDurableDirectoryAtURL(directory, 0755, 0, kVSANoProtectionClass, error))
    return false;
  auto bytes = VSAPlist::serialize(update.plist(), VSAPlist::Format::Binary, error);
  if (!bytes) return false;
  return fm.writeFileAtomicallyAtURL(url, *bytes, mode, protectionClass, error);
}
