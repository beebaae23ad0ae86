// The owner of per-user containers: uid, gid, home directory, persona type,
// persona unique string and kernel persona id, plus the derived identifier.
//
// Immutable; shared as VSAUserIdentityRef. Equality and hash use the
// identifier only (an enterprise identity's unique string, otherwise the uid
// in decimal), so the personal and unspecific identities of one uid are equal.
// The property-list form (version 2) is what other records store; reading it
// back resolves against the user identity cache (VSAUserIdentityCache.h).
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "model/VSAContainerClass.h"

enum VSAPersonaType : uint32_t {
  kVSAPersonaTypePersonal = 0,
  kVSAPersonaTypeEnterprise = 1,
  kVSAPersonaTypeUnspecific = 2,
};

inline constexpr uid_t kVSAMinimumUserUID = 501;

class VSAUserIdentity;
class VSAUserIdentityCache;
using VSAUserIdentityRef = std::shared_ptr<const VSAUserIdentity>;

class VSAUserIdentity {
 public:
  // initWithUID:GID:homeDirectoryURL:personaUniqueString:personaType:kernelPersonaID:
  // Nothing for a uid below 501 (logged).
  static VSAUserIdentityRef make(uid_t uid, gid_t gid, std::string homeDirectoryURL,
                                 std::optional<std::string> personaUniqueString,
                                 uint32_t personaType, int32_t kernelPersonaID);
  // userIdentityWithPlist:cache:error: resolves a stored identity against the
  // cache's current identities. A non-dictionary or a "version" other than
  // the strings "1" and "2" gives the bare identity and no error
  // (deliberately lenient); malformed fields fail with 75, an identity the
  // cache cannot produce with code 1.
  static VSAUserIdentityRef userIdentityWithPlist(const VSAValue& plist,
                                                  VSAUserIdentityCache& cache,
                                                  VSAResultCode* error);
  // The never-initialised identity that a plist of unknown version reads as.
  static VSAUserIdentityRef bare();

  const std::string& homeDirectoryURL() const { return home_; }
  int32_t kernelPersonaID() const { return kernelPersonaID_; }
  uid_t posixUID() const { return uid_; }
  gid_t posixGID() const { return gid_; }
  uint32_t personaType() const { return personaType_; }
  const std::optional<std::string>& personaUniqueString() const { return uniqueString_; }
  const std::string& identifier() const { return identifier_; }

  bool isEnterprise() const { return personaType_ == kVSAPersonaTypeEnterprise; }
  bool isNoSpecificPersona() const { return personaType_ == kVSAPersonaTypeUnspecific; }
  bool isHomeDirectoryInCommonSandbox() const {
    return personaType_ == kVSAPersonaTypePersonal || personaType_ == kVSAPersonaTypeUnspecific;
  }
  uid_t posixUIDForContainerClass(VSAContainerClass containerClass) const;
  // Deliberately answers the uid constants for bundle and system classes.
  gid_t posixGIDForContainerClass(VSAContainerClass containerClass) const;
  static bool isUserIdentityRequiredForContainerClass(VSAContainerClass containerClass);

  // Version-2 property list: posixUID, posixGID, type, version "2" and,
  // when present, personaUniqueString.
  VSAValue plist() const;

  bool isEqualToUserIdentity(const VSAUserIdentity& other) const {
    return this == &other || identifier_ == other.identifier_;
  }
  size_t hash() const { return std::hash<std::string>()(identifier_); }
  std::string shortDescription() const;
  std::string description() const;
  static const char* descriptionForPersonaType(uint32_t type);
  static std::string identifierForPOSIXUID(uid_t uid, const std::optional<std::string>& unique,
                                           uint32_t personaType);

  VSAUserIdentity(uid_t uid, gid_t gid, std::string home, std::optional<std::string> unique,
                  uint32_t personaType, int32_t kernelPersonaID);

 private:
  std::string home_;
  int32_t kernelPersonaID_;
  uid_t uid_;
  gid_t gid_;
  uint32_t personaType_;
  std::optional<std::string> uniqueString_;
  std::string identifier_;
};

// Equality of two (possibly absent) identities by identifier.
bool VSAUserIdentityEqual(const VSAUserIdentityRef& a, const VSAUserIdentityRef& b);

// Hash and equality for unordered containers of identities.
struct VSAUserIdentityHash {
  size_t operator()(const VSAUserIdentityRef& u) const { return u ? u->hash() : 0; }
};
struct VSAUserIdentityEq {
  bool operator()(const VSAUserIdentityRef& a, const VSAUserIdentityRef& b) const {
    return VSAUserIdentityEqual(a, b);
  }
};
