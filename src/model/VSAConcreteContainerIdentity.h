// A container identity plus the UUID that names one container directory.
// See VSAContainerIdentity.h for the (asymmetric) equality rule.
#pragma once

#include "base/VSAUUID.h"
#include "model/VSAContainerIdentity.h"

class VSAConcreteContainerIdentity;
using VSAConcreteContainerIdentityRef = std::shared_ptr<const VSAConcreteContainerIdentity>;

class VSAConcreteContainerIdentity : public VSAContainerIdentity {
 public:
  // containerIdentityWithUUID:userIdentity:identifier:containerClass:error:
  // The container-identity checks run first; then `uuid` must be a UUID (11).
  static VSAConcreteContainerIdentityRef containerIdentityWithUUID(
      const VSAValue* uuid, const VSAUserIdentityRef& userIdentity, const VSAValue* identifier,
      VSAContainerClass containerClass, VSAResultCode* error);
  static VSAConcreteContainerIdentityRef containerIdentityWithUUID(
      const VSAUUID& uuid, const VSAUserIdentityRef& userIdentity, const std::string& identifier,
      VSAContainerClass containerClass, VSAResultCode* error);

  const VSAUUID& uuid() const { return uuid_; }
  bool isEqual(const VSAContainerIdentity& other) const override;
  size_t hash() const override;
  std::string description() const override;
  bool isConcrete() const override { return true; }

  VSAConcreteContainerIdentity(VSAUUID uuid, VSAUserIdentityRef userIdentity,
                               std::string identifier, VSAContainerClass containerClass)
      : VSAContainerIdentity(std::move(userIdentity), std::move(identifier), containerClass),
        uuid_(uuid) {}

 private:
  VSAUUID uuid_;
};
