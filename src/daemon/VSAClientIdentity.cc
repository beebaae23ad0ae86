#include "daemon/VSAClientIdentity.h"

#include <mutex>

#include "base/VSALog.h"

namespace {
std::mutex gInstallerCacheLock;
VSAClientIdentityRef gInstallerIdentity;
}  // namespace

VSAClientIdentity::VSAClientIdentity(std::string bundleIdentifier, uint32_t uid, uint32_t gid,
                                     int32_t pid, VSAUserIdentityRef userIdentity,
                                     VSAValue entitlements, bool sandboxed,
                                     std::array<uint8_t, 32> auditToken, bool kernel)
    : bundleIdentifier_(std::move(bundleIdentifier)),
      uid_(uid),
      gid_(gid),
      pid_(pid),
      userIdentity_(std::move(userIdentity)),
      entitlements_(std::move(entitlements)),
      sandboxed_(sandboxed),
      auditToken_(auditToken),
      kernel_(kernel) {}

VSAClientIdentityRef VSAClientIdentity::clientIdentityWithRelayConnection(
    const VSAIPCConnection& connection, VSAUserIdentityCache& cache,
    VSACodeSigningMapping& mapping) {
  const VSAAuditToken& token = connection.auditToken();
  const auto& entry = connection.registryEntry();
  if (!entry) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, __func__,
             "Failed to copy signing ID for pid %d : %@", token.pid, "no client registry entry");
    return nullptr;
  }
  auto tokenBytes = token.bytes();
  bool installer = entry->signingIdentifier == kVSAInstallerSigningIdentifier;
  if (installer) {
    std::lock_guard lock(gInstallerCacheLock);
    if (gInstallerIdentity && gInstallerIdentity->auditToken() == tokenBytes)
      return gInstallerIdentity;
  }
  VSAClientIdentityRef identity;
  if (entry->launched) {
    if (auto user = cache.userIdentityForCurrentContextWithUID(token.uid, token.gid)) {
      auto launched = std::make_shared<VSAClientIdentity>(
          entry->signingIdentifier, token.uid, token.gid, token.pid, user,
          mapping.entitlementsForIdentifier(entry->signingIdentifier)
              .value_or(VSAValue::dictionary()),
          true, tokenBytes, false);
      launched->launchedApp_ = true;
      identity = std::move(launched);
    }
  } else if (!entry->entitlements.isDictionary()) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, __func__,
             "Missing or malformed entitlements for pid %d", token.pid);
  } else if (auto user = cache.userIdentityForCurrentContextWithUID(token.uid, token.gid)) {
    identity = std::make_shared<const VSAClientIdentity>(
        entry->signingIdentifier, token.uid, token.gid, token.pid, user, entry->entitlements,
        entry->sandboxed, tokenBytes, false);
  }
  if (installer) {
    std::lock_guard lock(gInstallerCacheLock);
    gInstallerIdentity = identity;
  }
  VSALogIn(VSALogCategory::Relay, kVSALogInfo, __func__, "[%s] Relay client identity: %@", __func__,
           identity);
  return identity;
}

VSAClientIdentityRef VSAClientIdentity::privilegedClientIdentityWithUserIdentity(
    const VSAUserIdentityRef& userIdentity, bool kernel) {
  return std::make_shared<const VSAClientIdentity>(kVSAInternalBundleIdentifier, 0, 0, 0,
                                                   userIdentity, VSAValue::dictionary(), false,
                                                   std::array<uint8_t, 32>{}, kernel);
}

VSAClientIdentityRef VSAClientIdentity::anonymousPrivilegedClientIdentity(
    VSAUserIdentityCache& cache) {
  return privilegedClientIdentityWithUserIdentity(cache.defaultUserIdentity(), false);
}

const VSAValue* VSAClientIdentity::valueOfEntitlement(const std::string& name) const {
  return entitlements_.get(name);
}

bool VSAClientIdentity::boolValueOfEntitlement(const std::string& name) const {
  const VSAValue* v = valueOfEntitlement(name);
  if (!v || !v->isNumber()) return false;
  return v->boolValue().value_or(false);
}

std::string VSAClientIdentity::description() const {
  return VSAFormat(
      "<VSAClientIdentity: uid = %u, gid = %u, pid = %d, sandboxed = %d, "
      "bundleIdentifier = %@>",
      uid_, gid_, pid_, sandboxed_, bundleIdentifier_);
}
