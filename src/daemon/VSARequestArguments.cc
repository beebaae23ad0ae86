#include "daemon/VSARequestArguments.h"

#include "base/VSALog.h"
#include "base/VSALogRateLimiter.h"
#include "base/VSAPathString.h"
#include "daemon/VSAClientConnection.h"

namespace {
const char* const kOrigin = "VSARequestArguments";
}

bool VSARequestArguments::acceptClientName(const std::string& value, const char* key) {
  if (VSAIsSafeFileName(value)) return true;
  const auto& client = connection_.clientIdentity();
  uint64_t suppressed = 0;
  if (VSALogRateLimiter::refusals().admit(client ? client->posixUID() : 0, &suppressed)) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Refusing %s [%@] (%zu bytes) from %@: not a valid name%s", key,
             VSAClientStringForLog(value), value.size(),
             client ? client->description() : std::string("(none)"),
             suppressed ? VSAFormat(" (%llu refusals not logged)", suppressed) : std::string());
  }
  fail(VSAResult::kInvalidArgument);
  return false;
}

std::optional<VSAContainerClass> VSARequestArguments::containerClass(const char* key) {
  const VSAValue* value = request_.get(key);
  auto c = value && value->isInteger() ? value->uint64Value() : std::nullopt;
  if (!c || !VSAContainerClassIsValid(*c)) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "Invalid container class: %@",
             value ? value->description() : std::string("(none)"));
    fail(VSAResult::kInvalidClass);
    return std::nullopt;
  }
  return *c;
}

const std::string* VSARequestArguments::identifier(const char* key) {
  const VSAValue* value = request_.get(key);
  if (!value || !value->isString() || value->stringValue()->empty()) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin, "Request without identifier (%s)", key);
    fail(VSAResult::kMissingIdentifier);
    return nullptr;
  }
  if (!acceptClientName(*value->stringValue(), key)) return nullptr;
  return value->stringValue();
}

bool VSARequestArguments::boolValue(const char* key, bool fallback) const {
  const VSAValue* value = request_.get(key);
  return value ? value->boolValue().value_or(fallback) : fallback;
}

VSAUserIdentityRef VSARequestArguments::userIdentity(VSAContainerClass containerClass,
                                                     const char* personaKey) {
  auto& context = connection_.context();
  const auto& client = connection_.clientIdentity();
  VSAUserIdentityRef own = client ? client->userIdentity() : nullptr;
  if (!own) own = context.userIdentityCache->defaultUserIdentity();
  const VSAValue* persona = request_.get(personaKey);
  if (!VSAUserIdentity::isUserIdentityRequiredForContainerClass(containerClass) || !persona ||
      context.deviceProperties->isMultiUser())
    return own;
  if (persona->isString() && !acceptClientName(*persona->stringValue(), personaKey)) return nullptr;
  std::string clientText = client ? client->description() : std::string("(none)");
  std::string personaText =
      VSAClientStringForLog(persona->isString() ? *persona->stringValue() : persona->description());
  VSAUserIdentityRef named = persona->isString()
                                 ? context.userIdentityCache->userIdentityForPersonaUniqueString(
                                       *persona->stringValue(), own->posixUID(), own->posixGID())
                                 : nullptr;
  if (!named) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Cannot reconstitute a user identity from provided persona unique string; client = "
             "[%@], personaUniqueString = [%@]",
             clientText, personaText);
    fail(VSAResult::kInvalidPersona);
    return nullptr;
  }
  // A persona belongs to a client that runs in it, whose app it lists, or
  // that may act for every container.
  bool belongs = connection_.unrestricted() || named->isEqualToUserIdentity(*own) ||
                 (client && context.userIdentityCache->isBundleIdentifierAssociatedWithUserIdentity(
                                client->bundleIdentifier(), named));
  if (!belongs) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, kOrigin,
             "Persona unique string is not valid for this client; client = [%@], "
             "personaUniqueString = [%@]",
             clientText, personaText);
    fail(VSAResult::kInvalidPersona);
    return nullptr;
  }
  return named;
}

VSAContainerIdentityRef VSARequestArguments::containerIdentity(
    const VSAIdentityKeys& keys, std::optional<VSAContainerClass> fixedClass) {
  auto c = fixedClass ? fixedClass : containerClass(keys.containerClass);
  if (!c) return nullptr;
  const std::string* id = identifier(keys.identifier);
  if (!id) return nullptr;
  VSAUserIdentityRef user = userIdentity(*c, keys.personaUniqueString);
  if (!user) return nullptr;
  VSAResultCode code = VSAResult::kSuccess;
  auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(user, *id, *c, &code);
  if (!identity) fail(code == VSAResult::kSuccess ? VSAResult::kInvalidArgument : code);
  return identity;
}

VSAConcreteContainerIdentityRef VSARequestArguments::concreteContainerIdentity(
    const VSAIdentityKeys& keys) {
  auto plain = containerIdentity(keys);
  if (!plain) return nullptr;
  VSAResultCode code = VSAResult::kSuccess;
  auto identity = VSAConcreteContainerIdentity::containerIdentityWithUUID(
      request_.get(keys.uuid), plain->userIdentity(), request_.get(keys.identifier),
      plain->containerClass(), &code);
  if (!identity) fail(code == VSAResult::kSuccess ? VSAResult::kInvalidArgument : code);
  return identity;
}

VSAContainerIdentityRef VSARequestArguments::namedContainerIdentity(
    const VSAIdentityKeys& keys, std::optional<VSAContainerClass> fixedClass) {
  if (!request_.get(keys.uuid) || fixedClass) return containerIdentity(keys, fixedClass);
  return concreteContainerIdentity(keys);
}
