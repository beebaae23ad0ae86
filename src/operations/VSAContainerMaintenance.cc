#include "operations/VSAContainerMaintenance.h"

#include <exception>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "model/VSAConcreteContainerIdentity.h"
#include "operations/VSAContainerDirectories.h"
#include "operations/VSAContainerLookup.h"

namespace {

bool fail(const char* origin, VSAResultCode code, VSAResultCode* cell, const std::string& message,
          int level = kVSALogError) {
  VSALog(level, origin, "%@", message);
  VSASetCode(cell, code);
  return false;
}

// Runs one operation body; an exception becomes code 40, except on internal
// builds, where it ends the process for a crash report.
template <typename Body>
auto guarded(const char* origin, bool internal, VSAResultCode* cell, Body body)
    -> decltype(body()) {
  try {
    return body();
  } catch (const std::exception& e) {
    if (internal) std::terminate();
    fail(origin, VSAResult::kExceptionInTransaction, cell,
         VSAFormat("Got exception: %@ : %@", "std::exception", e.what()));
    return {};
  }
}

bool isStringKey(const VSAValue* key, const char* origin, VSAResultCode* cell) {
  if (key && key->isString()) return true;
  return fail(origin, VSAResult::kOutOfRange, cell,
              VSAFormat("Invalid info key: %@", key ? key->description() : std::string("(null)")));
}
}  // namespace

VSAMetadataRef VSAContainerMaintenance::find(const VSAContainerIdentityRef& identity,
                                             const char* origin, VSAResultCode* withError) {
  VSAMetadataRef m =
      identity ? VSAContainerLookup::containerForIdentity(*services_.containerCache, *identity)
               : nullptr;
  if (!m)
    fail(origin, VSAResult::kContainerNotFound, withError,
         VSAFormat("No Container with identity: %@",
                   identity ? identity->description() : std::string("(null)")));
  return m;
}

VSAMetadataRef VSAContainerMaintenance::findLocked(const VSAContainerIdentityRef& identity,
                                                   const std::optional<std::string>& key,
                                                   const char* origin, VSAResultCode* withError) {
  auto m = find(identity, origin, withError);
  // A plain identity's container may have been replaced by another between
  // learning its UUID and taking the lock.
  if (m && key && m->uuid().string() != *key) {
    fail(origin, VSAResult::kContainerNotFound, withError,
         VSAFormat("No Container with identity: %@", identity->description()));
    return nullptr;
  }
  return m;
}

std::optional<std::string> VSAContainerMaintenance::lockKey(const VSAContainerIdentityRef& identity,
                                                            const char* origin,
                                                            VSAResultCode* withError) {
  if (identity && identity->isConcrete())
    return static_cast<const VSAConcreteContainerIdentity&>(*identity).uuid().string();
  auto m = find(identity, origin, withError);
  if (!m) return std::nullopt;
  return m->uuid().string();
}

VSAMetadataRef VSAContainerMaintenance::reread(const VSAMetadata& cached, const char* origin,
                                               VSAResultCode* withError) {
  VSAErrorRef error;
  auto fresh = VSAMetadata::rereadMetadataOfCachedContainer(cached, *services_.configuration,
                                                            *services_.userIdentityCache, &error);
  if (!fresh) {
    fail(origin,
         error ? error->resultCode(VSAResult::kMetadataUnreadable) : VSAResult::kMetadataUnreadable,
         withError, VSAFormat("Failed to read metadata of %@: %@", cached.url(), error));
    return nullptr;
  }
  return fresh;
}

bool VSAContainerMaintenance::regenerateDirectoryUUIDWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  const char* origin = "regenerateDirectoryUUIDWithContainerIdentity";
  VSAAllIdentifiersLockGuard lock(*services_.locks, true);
  return guarded(origin, services_.configuration->isInternalImage(), withError, [&] {
    auto m = find(identity, origin, withError);
    if (!m) return false;
    std::string name = VSALastPathComponent(m->url());
    if (!VSAUUID::parse(name))
      return fail(
          origin, VSAResult::kInvalidArgument, withError,
          VSAFormat("Non-UUID last path component: %@ for %@", name, identity->description()));
    std::string moved = VSAPathJoin(VSADirectoryName(m->url()), VSAUUID::random().string());
    VSAErrorRef error;
    if (!services_.fileManager->moveItemAtURL(m->url(), moved, &error))
      return fail(origin, VSAResult::kMoveToNewUUIDFailed, withError,
                  VSAFormat("Failed to move dir: %@ to new UUID dir: %@", m->url(), moved));
    m->setUrl(moved);
    if (!services_.containerCache->addContainerMetadata(
            *m, moved, {.transient = m->transient(), .updateSandbox = true}, &error))
      return fail(origin, VSAResult::kCacheAddFailed, withError,
                  VSAFormat("Failed to add to cache: %@, url: %@, transient: %d", *m, moved,
                            m->transient()));
    return true;
  });
}

bool VSAContainerMaintenance::recreateDefaultStructureWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  const char* origin = "recreateDefaultStructureWithContainerIdentity";
  auto key = lockKey(identity, origin, withError);
  if (!key) return false;
  VSAIdentifierLockGuard lock(*services_.locks, VSAValue(*key), true);
  return guarded(origin, services_.configuration->isInternalImage(), withError, [&] {
    auto m = findLocked(identity, key, origin, withError);
    if (!m) return false;
    VSAErrorRef error;
    // A live container: what is made is synced as it is made, or a power
    // loss takes back the structure the reply reported recreated.
    if (!VSAContainerDirectories(services_)._createSubDirectories(m->url(), *m, &error, true) ||
        (VSAContainerClassIsSystem(m->containerClass()) &&
         !services_.fileManager->standardizeACLsForSystemContainerAtURL(m->url(), &error))) {
      VSASetCode(withError,
                 error ? error->resultCode(VSAResult::kACLFailed) : VSAResult::kACLFailed);
      return false;
    }
    return true;
  });
}

std::optional<VSAValue> VSAContainerMaintenance::infoValueForKey(
    const VSAValue* key, const VSAContainerIdentityRef& identity, bool useLocking,
    VSAResultCode* withError) {
  const char* origin = "infoValueForKey";
  if (!isStringKey(key, origin, withError)) return std::nullopt;
  std::optional<std::string> lockName;
  if (useLocking && !(lockName = lockKey(identity, origin, withError))) return std::nullopt;
  VSAIdentifierLockGuard lock(*services_.locks, VSAValue(lockName.value_or("")), false, useLocking);
  return guarded(
      origin, services_.configuration->isInternalImage(), withError,
      [&]() -> std::optional<VSAValue> {
        auto m = findLocked(identity, lockName, origin, withError);
        if (!m || !(m = reread(*m, origin, withError))) return std::nullopt;
        const VSAValue* value = m->info() ? m->info()->get(*key->stringValue()) : nullptr;
        if (!value) {
          fail(origin, VSAResult::kInfoValueNotSet, withError,
               VSAFormat("Didn't find info value for key: %@", *key->stringValue()), kVSALogDebug);
          return std::nullopt;
        }
        return *value;
      });
}

bool VSAContainerMaintenance::setInfoValue(const VSAValue* value, const VSAValue* forKey,
                                           const VSAContainerIdentityRef& identity, bool useLocking,
                                           VSAResultCode* withError) {
  const char* origin = "setInfoValue";
  if (!isStringKey(forKey, origin, withError)) return false;
  std::optional<std::string> lockName;
  if (useLocking && !(lockName = lockKey(identity, origin, withError))) return false;
  VSAIdentifierLockGuard lock(*services_.locks, VSAValue(lockName.value_or("")), true, useLocking);
  return guarded(origin, services_.configuration->isInternalImage(), withError, [&] {
    auto cached = findLocked(identity, lockName, origin, withError);
    if (!cached) return false;
    auto m = reread(*cached, origin, withError);
    if (!m) return false;
    VSAValue info = m->info() && m->info()->isDictionary() ? *m->info() : VSAValue::dictionary();
    if (value)
      info.set(*forKey->stringValue(), *value);
    else
      info.remove(*forKey->stringValue());
    m->setInfo(std::move(info));
    // A metadata file the daemon could not read back would lose the container.
    auto bytes = VSAPlist::serialize(m->plist(), VSAPlist::Format::Binary, nullptr);
    if (!bytes || bytes->size() > kVSAMetadataFileMaxSize)
      return fail(origin, VSAResult::kOutOfRange, withError,
                  VSAFormat("Info value for key %@ would make the metadata file of %@ too large",
                            VSAClientStringForLog(*forKey->stringValue()), m->url()));
    VSAErrorRef error;
    if (!m->writeMetadataToDiskWithError(*services_.configuration, &error)) {
      VSASetCode(withError,
                 error ? error->resultCode(VSAResult::kWriteFailed) : VSAResult::kWriteFailed);
      return false;
    }
    if (!services_.containerCache->addContainerMetadata(
            *m, m->url(), {.transient = m->transient(), .updateSandbox = true}, &error))
      return fail(origin, VSAResult::kCacheAddFailed, withError,
                  VSAFormat("Failed to add to cache: %@, url: %@, transient: %d", *m, m->url(),
                            m->transient()));
    return true;
  });
}
