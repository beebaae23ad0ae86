// Look-ups of VSAUserIdentityCache (the rebuild and flush live in
// VSAUserIdentityCache.cc).
#include "base/VSALog.h"
#include "model/VSAUserIdentityCache.h"

namespace {
constexpr const char* kOrigin = "VSAUserIdentityCache";
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityWithPersonaID(uint32_t personaID) {
  auto s = snapshot();
  auto it = s->personaIDToUserIdentity.find(personaID);
  return it == s->personaIDToUserIdentity.end() ? nullptr : it->second;
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityForPersonalPersona() {
  return userIdentityForPersonalPersonaWithUID(deps_.mobileUID, deps_.mobileGID);
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityForPersonalPersonaWithUID(uid_t uid,
                                                                               gid_t gid) {
  applyUIDFloor(uid, gid);
  return rebasedIfNeeded(snapshot()->personal, uid, gid);
}

VSAUserIdentityRef VSAUserIdentityCache::unspecificUserIdentity() { return snapshot()->unspecific; }

VSAUserIdentityRef VSAUserIdentityCache::lookUpPersonaUniqueString(
    const std::optional<std::string>& unique) {
  auto s = snapshot();
  if (!personasAreSupported()) return s->personal;
  if (!unique) return s->unspecific;
  auto it = s->personaUniqueStringToUserIdentity.find(*unique);
  if (it == s->personaUniqueStringToUserIdentity.end()) return nullptr;
  VSALog(kVSALogDebug, kOrigin, "Found %@ for %@", it->second, *unique);
  return it->second;
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityForPersonaUniqueString(
    const std::optional<std::string>& unique, uid_t uid, gid_t gid) {
  applyUIDFloor(uid, gid);
  return rebasedIfNeeded(lookUpPersonaUniqueString(unique), uid, gid);
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityForCurrentUserWithPersonaUniqueString(
    const std::optional<std::string>& unique) {
  return lookUpPersonaUniqueString(unique);
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityForCurrentContext() {
  return userIdentityForCurrentContextWithUID(deps_.mobileUID, deps_.mobileGID);
}

VSAUserIdentityRef VSAUserIdentityCache::userIdentityForCurrentContextWithUID(uid_t uid,
                                                                              gid_t gid) {
  applyUIDFloor(uid, gid);
  VSAUserIdentityRef result;
  if (!personasAreSupported()) {
    result = userIdentityForPersonalPersonaWithUID(uid, gid);
    VSALog(kVSALogDebug, kOrigin, "(%d/%d) Personas not supported, using: %@", uid, gid, result);
    return result;
  }
  auto persona = deps_.personaService ? deps_.personaService->currentPersona() : std::nullopt;
  if (persona && persona->isPersonal()) {
    result = userIdentityForPersonalPersonaWithUID(uid, gid);
    VSALog(kVSALogDebug, kOrigin, "(%d/%d) Explicit personal persona, using: %@", uid, gid, result);
  } else if (persona && persona->isEnterprise() && persona->uniqueString) {
    result = userIdentityForPersonaUniqueString(persona->uniqueString, uid, gid);
    VSALog(kVSALogDebug, kOrigin, "(%d/%d) Looked up user identity for [%@]: %@", uid, gid,
           *persona->uniqueString, result);
  } else {
    result = rebasedIfNeeded(unspecificUserIdentity(), uid, gid);
    VSALog(kVSALogDebug, kOrigin, "(%d/%d) No persona (<%p>) or no unique string [%@], using: %@",
           uid, gid, persona ? static_cast<const void*>(&*persona) : nullptr,
           persona && persona->uniqueString ? *persona->uniqueString : std::string("(null)"),
           result);
  }
  return result;
}

VSAUserIdentitySet VSAUserIdentityCache::userIdentitiesForBundleIdentifier(
    const std::string& bundleIdentifier) {
  auto s = snapshot();
  auto it = s->bundleToEnterpriseIdentities.find(bundleIdentifier);
  if (it != s->bundleToEnterpriseIdentities.end()) return it->second;
  return VSAUserIdentitySet{s->personal};
}

bool VSAUserIdentityCache::isBundleIdentifierAssociatedWithUserIdentity(
    const std::string& bundleIdentifier, const VSAUserIdentityRef& identity) {
  if (!personasAreSupported()) return true;
  return userIdentitiesForBundleIdentifier(bundleIdentifier).count(identity) > 0;
}

void VSAUserIdentityCache::forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
    const std::function<void(const VSAUserIdentityRef&)>& block) {
  if (!personasAreSupported()) {
    block(defaultUserIdentity());
    return;
  }
  VSAUserIdentitySet identities;
  auto s = snapshot();
  for (const auto& [unique, identity] : s->personaUniqueStringToUserIdentity)
    identities.insert(identity);
  if (identities.empty()) {
    VSALog(kVSALogError, kOrigin,
           "Expected to find at least one persona; self = %@, personaAttributeList = %@",
           description(), "(none)");
    block(defaultUserIdentity());
    return;
  }
  for (const auto& identity : identities) block(identity);
}
