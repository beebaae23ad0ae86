#include "model/VSAConcreteContainerIdentity.h"

#include "base/VSALog.h"

VSAConcreteContainerIdentityRef VSAConcreteContainerIdentity::containerIdentityWithUUID(
    const VSAValue* uuid, const VSAUserIdentityRef& userIdentity, const VSAValue* identifier,
    VSAContainerClass containerClass, VSAResultCode* error) {
  if (!validate(userIdentity, identifier, containerClass, "initWithUUID", error)) return nullptr;
  // Only a UUID value (or its 16 bytes on the wire) is a UUID; text is not.
  std::optional<VSAUUID> parsed;
  if (uuid && (uuid->type() == VSAValue::Type::UUID || uuid->isData())) parsed = uuid->uuidValue();
  if (!parsed) {
    VSALog(kVSALogError, "initWithUUID", "Invalid object: uuid = [%@]",
           uuid ? uuid->description() : std::string("(null)"));
    VSASetCode(error, VSAResult::kInvalidArgument);
    return nullptr;
  }
  return std::make_shared<const VSAConcreteContainerIdentity>(
      *parsed, userIdentity, *identifier->stringValue(), containerClass);
}

VSAConcreteContainerIdentityRef VSAConcreteContainerIdentity::containerIdentityWithUUID(
    const VSAUUID& uuid, const VSAUserIdentityRef& userIdentity, const std::string& identifier,
    VSAContainerClass containerClass, VSAResultCode* error) {
  VSAValue u(uuid), id(identifier);
  return containerIdentityWithUUID(&u, userIdentity, &id, containerClass, error);
}

bool VSAConcreteContainerIdentity::isEqual(const VSAContainerIdentity& other) const {
  if (this == &other) return true;
  if (!other.isConcrete()) return false;
  const auto& o = static_cast<const VSAConcreteContainerIdentity&>(other);
  return uuid_ == o.uuid_ && tripleEquals(other);
}

size_t VSAConcreteContainerIdentity::hash() const {
  return VSAContainerIdentity::hash() ^ std::hash<std::string>()(uuid_.string());
}

std::string VSAConcreteContainerIdentity::description() const {
  return VSAFormat("<%@: %p; userIdentity = %@, identifier = %@, class = %llu, uuid = %@>",
                   "VSAConcreteContainerIdentity", static_cast<const void*>(this),
                   userIdentity() ? userIdentity()->shortDescription() : std::string("(null)"),
                   identifier(), containerClass(), uuid_);
}
