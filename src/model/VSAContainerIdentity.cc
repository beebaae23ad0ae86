#include "model/VSAContainerIdentity.h"

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "model/VSAUserIdentityCache.h"

VSAContainerIdentity::VSAContainerIdentity(VSAUserIdentityRef userIdentity, std::string identifier,
                                           VSAContainerClass containerClass)
    : identifier_(std::move(identifier)),
      containerClass_(containerClass),
      userIdentity_(std::move(userIdentity)) {}

bool VSAContainerIdentity::validate(const VSAUserIdentityRef& userIdentity,
                                    const VSAValue* identifier, VSAContainerClass containerClass,
                                    const char* method, VSAResultCode* error) {
  if (!userIdentity) {
    VSALog(kVSALogError, method, "Invalid object: no user identity");
    VSASetCode(error, VSAResult::kInvalidArgument);
    return false;
  }
  if (!identifier || identifier->isNull()) {
    VSALog(kVSALogError, method, "Invalid object: missing identifier");
    VSASetCode(error, VSAResult::kMissingIdentifier);
    return false;
  }
  // Identifiers name directories and files: one that could leave its
  // directory is refused here as well as at the request boundary.
  if (!identifier->isString() || !VSAIsSafeFileName(*identifier->stringValue())) {
    VSALog(kVSALogError, method, "Invalid object: identifier = [%@]",
           VSAClientStringForLog(identifier->isString() ? *identifier->stringValue()
                                                        : identifier->description()));
    VSASetCode(error, VSAResult::kInvalidArgument);
    return false;
  }
  if (!VSAContainerClassIsValid(containerClass)) {
    VSALog(kVSALogError, method, "Invalid object: container class = %llu", containerClass);
    VSASetCode(error, VSAResult::kInvalidArgument);
    return false;
  }
  return true;
}

VSAContainerIdentityRef VSAContainerIdentity::containerIdentityWithUserIdentity(
    const VSAUserIdentityRef& userIdentity, const VSAValue* identifier,
    VSAContainerClass containerClass, VSAResultCode* error) {
  if (!validate(userIdentity, identifier, containerClass, "initWithUserIdentity", error))
    return nullptr;
  return std::make_shared<const VSAContainerIdentity>(userIdentity, *identifier->stringValue(),
                                                      containerClass);
}

VSAContainerIdentityRef VSAContainerIdentity::containerIdentityWithUserIdentity(
    const VSAUserIdentityRef& userIdentity, const std::string& identifier,
    VSAContainerClass containerClass, VSAResultCode* error) {
  VSAValue value(identifier);
  return containerIdentityWithUserIdentity(userIdentity, &value, containerClass, error);
}

VSAContainerIdentityRef VSAContainerIdentity::containerIdentityWithIdentifier(
    const std::string& identifier, VSAContainerClass containerClass, VSAUserIdentityCache& cache,
    VSAResultCode* error) {
  if (VSAUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
    VSALog(kVSALogFault, "containerIdentityWithIdentifier",
           "Attempt to create a container identity without a user identity when one is required; "
           "identifier = [%@], class = %llu",
           identifier, containerClass);
    VSASetCode(error, VSAResult::kInvalidArgument);
    return nullptr;
  }
  return containerIdentityWithUserIdentity(cache.defaultUserIdentity(), identifier, containerClass,
                                           error);
}

bool VSAContainerIdentity::tripleEquals(const VSAContainerIdentity& other) const {
  return identifier_ == other.identifier_ && containerClass_ == other.containerClass_ &&
         VSAUserIdentityEqual(userIdentity_, other.userIdentity_);
}

bool VSAContainerIdentity::isEqual(const VSAContainerIdentity& other) const {
  return this == &other || tripleEquals(other);
}

size_t VSAContainerIdentity::hash() const {
  return std::hash<std::string>()(identifier_) ^ (userIdentity_ ? userIdentity_->hash() : 0) ^
         static_cast<size_t>(containerClass_);
}

std::string VSAContainerIdentity::description() const {
  return VSAFormat("<%@: %p; userIdentity = %@, identifier = %@, class = %llu>",
                   "VSAContainerIdentity", static_cast<const void*>(this),
                   userIdentity_ ? userIdentity_->shortDescription() : std::string("(null)"),
                   identifier_, containerClass_);
}
