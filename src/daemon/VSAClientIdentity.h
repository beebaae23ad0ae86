// Who is asking: an IPC peer, the kernel (upcalls) or the daemon itself.
//
// Immutable after creation and shared freely. A peer's identity comes from
// its audit token and the registry entry its connection resolved when it was
// accepted (signing identifier, entitlements, sandboxed flag); a peer without
// a registry entry has no signing identifier and therefore no identity. A
// process the launcher started as an app is that app (its launch record):
// sandboxed, with the entitlements the code-signing database holds for it
// (none when it has no entry). One identity is cached: the
// installer service's, reused while its audit token matches byte for byte.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <string>

#include "base/VSAValue.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "model/VSAUserIdentityCache.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAIPCConnection.h"

inline constexpr const char* kVSAInstallerSigningIdentifier = "com.tamsk.mobile.installd";
inline constexpr const char* kVSAInternalBundleIdentifier = "com.tamsk.vessad.internal";

class VSAClientIdentity;
using VSAClientIdentityRef = std::shared_ptr<const VSAClientIdentity>;

class VSAClientIdentity {
 public:
  // initWithBundleIdentifier:UID:GID:PID:userIdentity:entitlements:sandboxed:auditToken:kernel:
  VSAClientIdentity(std::string bundleIdentifier, uint32_t uid, uint32_t gid, int32_t pid,
                    VSAUserIdentityRef userIdentity, VSAValue entitlements, bool sandboxed,
                    std::array<uint8_t, 32> auditToken, bool kernel);

  // The peer's identity, from the registry entry pinned on its connection;
  // its user identity is that of the persona the calling thread serves (see
  // VSACurrentPersonaScope). Nothing without a registry entry, entitlements
  // or user identity. The caller has checked that the peer still runs the
  // executable the entry was resolved for.
  // `mapping` answers the entitlements of launched apps.
  static VSAClientIdentityRef clientIdentityWithRelayConnection(const VSAIPCConnection& connection,
                                                                VSAUserIdentityCache& cache,
                                                                VSACodeSigningMapping& mapping);
  static VSAClientIdentityRef privilegedClientIdentityWithUserIdentity(
      const VSAUserIdentityRef& userIdentity, bool kernel);
  static VSAClientIdentityRef anonymousPrivilegedClientIdentity(VSAUserIdentityCache& cache);

  const std::string& bundleIdentifier() const { return bundleIdentifier_; }
  uint32_t posixUID() const { return uid_; }
  uint32_t posixGID() const { return gid_; }
  int32_t posixPID() const { return pid_; }
  const VSAValue& entitlements() const { return entitlements_; }
  bool isSandboxed() const { return sandboxed_; }
  const std::array<uint8_t, 32>& auditToken() const { return auditToken_; }
  bool isKernel() const { return kernel_; }
  // Started by the launcher as an app: its entitlements are the database's,
  // nothing the process itself could present.
  bool isLaunchedApp() const { return launchedApp_; }
  const VSAUserIdentityRef& userIdentity() const { return userIdentity_; }
  uid_t posixUIDForContainerClass(VSAContainerClass c) const {
    return userIdentity_ ? userIdentity_->posixUIDForContainerClass(c) : uid_;
  }
  gid_t posixGIDForContainerClass(VSAContainerClass c) const {
    return userIdentity_ ? userIdentity_->posixGIDForContainerClass(c) : gid_;
  }

  // The entitlement's truth value when it is a number; false otherwise
  // (missing, string, array or dictionary values are not granted).
  bool boolValueOfEntitlement(const std::string& name) const;
  const VSAValue* valueOfEntitlement(const std::string& name) const;
  std::string description() const;

 private:
  std::string bundleIdentifier_;
  uint32_t uid_;
  uint32_t gid_;
  int32_t pid_;
  VSAUserIdentityRef userIdentity_;
  VSAValue entitlements_;
  bool sandboxed_;
  std::array<uint8_t, 32> auditToken_;
  bool kernel_;
  bool launchedApp_ = false;
};
