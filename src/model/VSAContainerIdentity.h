// A container's name: owner (user identity), identifier and class.
//
// Immutable; shared as VSAContainerIdentityRef. Two identities are equal when
// identifier, class and owner (by the owner's identifier) are equal. The
// concrete subclass adds the UUID that names one container directory; the
// comparison is deliberately asymmetric: a plain identity compares the
// triple only (and may equal a concrete one), a concrete identity also
// requires the other to be concrete with the same UUID.
#pragma once

#include <memory>
#include <string>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "model/VSAContainerClass.h"
#include "model/VSAUserIdentity.h"

class VSAUserIdentityCache;
class VSAContainerIdentity;
using VSAContainerIdentityRef = std::shared_ptr<const VSAContainerIdentity>;

class VSAContainerIdentity {
 public:
  // containerIdentityWithUserIdentity:identifier:containerClass:error:
  // `identifier` may be absent (18) or not a string (11); an absent owner
  // fails first (11), then the class is checked (11).
  static VSAContainerIdentityRef containerIdentityWithUserIdentity(
      const VSAUserIdentityRef& userIdentity, const VSAValue* identifier,
      VSAContainerClass containerClass, VSAResultCode* error);
  static VSAContainerIdentityRef containerIdentityWithUserIdentity(
      const VSAUserIdentityRef& userIdentity, const std::string& identifier,
      VSAContainerClass containerClass, VSAResultCode* error);
  // For classes that need no user identity: owned by the default identity.
  static VSAContainerIdentityRef containerIdentityWithIdentifier(const std::string& identifier,
                                                                 VSAContainerClass containerClass,
                                                                 VSAUserIdentityCache& cache,
                                                                 VSAResultCode* error);

  virtual ~VSAContainerIdentity() = default;

  const std::string& identifier() const { return identifier_; }
  VSAContainerClass containerClass() const { return containerClass_; }
  const VSAUserIdentityRef& userIdentity() const { return userIdentity_; }
  uid_t posixUID() const { return userIdentity_->posixUIDForContainerClass(containerClass_); }
  gid_t posixGID() const { return userIdentity_->posixGIDForContainerClass(containerClass_); }

  virtual bool isEqual(const VSAContainerIdentity& other) const;
  virtual size_t hash() const;
  virtual std::string description() const;
  virtual bool isConcrete() const { return false; }

  VSAContainerIdentity(VSAUserIdentityRef userIdentity, std::string identifier,
                       VSAContainerClass containerClass);

 protected:
  // Runs the validation in order; on failure logs and stores the code.
  static bool validate(const VSAUserIdentityRef& userIdentity, const VSAValue* identifier,
                       VSAContainerClass containerClass, const char* method, VSAResultCode* error);
  bool tripleEquals(const VSAContainerIdentity& other) const;

 private:
  std::string identifier_;
  VSAContainerClass containerClass_;
  VSAUserIdentityRef userIdentity_;
};
