#include "operations/VSAContentWipe.h"

#include "base/VSALog.h"
#include "model/VSAConcreteContainerIdentity.h"
#include "operations/VSAContainerLookup.h"
#include "operations/VSAReplaceOperation.h"

namespace {
const char* const kOrigin = "deleteDataContainerContentWithContainerIdentity";

// The data classes and the app group: every per-user class.
bool isDataClass(VSAContainerClass c) { return VSAContainerClassIsPerUser(c); }
}  // namespace

void VSAContentWipe::deleteDataContainerContentWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  auto refuse = [&](VSAResultCode code, const std::string& message) {
    VSALog(kVSALogError, kOrigin, "%@", message);
    VSASetCode(withError, code);
  };
  if (!identity || identity->identifier().empty())
    return refuse(VSAResult::kMissingIdentifier,
                  VSAFormat("Can't wipe container with nil identifier: %@",
                            identity ? identity->description() : std::string("(null)")));
  VSAContainerClass c = identity->containerClass();
  const std::string& id = identity->identifier();
  if (!isDataClass(c))
    return refuse(VSAResult::kInvalidArgument,
                  VSAFormat("Can't wipe container non-data container of type: %llu, identifier: %@",
                            static_cast<unsigned long long>(c), id));
  if (!grants_.unrestricted) {
    if (c != VSAClass::kDataPlugin)
      return refuse(VSAResult::kNotEntitled,
                    VSAFormat("Can't wipe container with of type: %llu, identifier: %@",
                              static_cast<unsigned long long>(c), id));
    if (!grants_.isEntitledToWipe(id))
      return refuse(VSAResult::kNotEntitled,
                    VSAFormat("Not entitled to wipe container with identifier: %@", id));
  }
  grants_.allowOtherIdLookup = true;
  VSAContainerLookup lookup(services_, grants_);
  VSAResultCode code = VSAResult::kSuccess;
  auto existing = lookup.createOrLookupContainerWithContainerIdentity(identity, {}, &code);
  if (!existing)
    return refuse(code,
                  VSAFormat("Failed to lookup existing container to wipe-identifier: %@", id));
  auto fresh = lookup.createOrLookupContainerWithContainerIdentity(
      identity, {.createIfNecessary = true, .transient = true}, &code);
  if (!fresh)
    return refuse(code,
                  VSAFormat("Failed to create transient container for wipe-identifier: %@", id));
  if (!VSAReplaceOperation(services_).replaceContainerIdentity(
          existing->containerIdentity(), fresh->containerIdentity(), true, true, &code))
    return refuse(code, "Failed replace operation during delete all content");
  VSALog(kVSALogNotice, kOrigin, "Wiped the content of %@ at %@", id, existing->url());
}
