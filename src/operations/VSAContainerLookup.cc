// Create or look up a container: the access tests, the locked lookup, and
// creation in staging followed by one rename into place; listing a class and
// reading a container's metadata.
#include "operations/VSAContainerLookup.h"

#include <exception>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSATestLocks.h"
#include "model/VSAConcreteContainerIdentity.h"
#include "operations/VSAContainerDirectories.h"

namespace {
const char* const kOrigin = "createOrLookupContainerWithContainerIdentity";

VSAErrorRef failure(VSAResultCode code, VSAErrorRef underlying, std::string message) {
  auto e = VSAError::make(code, std::move(underlying), kOrigin, __LINE__, "%@", message);
  VSALog(kVSALogError, kOrigin, "%@", message);
  return e;
}

// Holds the all-identifiers lock in one mode at a time, released on every path.
class GlobalLock {
 public:
  GlobalLock(VSALocks& locks, bool useLocking) : locks_(locks), useLocking_(useLocking) {}
  ~GlobalLock() { release(); }
  void acquire(bool writing) {
    if (!useLocking_) return;
    release();
    writing ? locks_.lock_all_identifiers_write() : locks_.lock_all_identifiers_read();
    held_ = true;
  }
  void release() {
    if (held_) locks_.unlock_all_identifiers();
    held_ = false;
  }

 private:
  VSALocks& locks_;
  bool useLocking_;
  bool held_ = false;
};

bool isNotFound(const VSAErrorRef& e) {
  return e && e->domain() == kVSAErrorDomain && e->code() == VSAResult::kContainerNotFound;
}
}  // namespace

namespace {
struct CreateSteps {
  const VSAOperationServices& services;
  const VSAOperationGrants& grants;
  const VSAContainerIdentity& identity;
  bool transient;

  bool whitelisted(const std::string& client, VSAContainerClass c, const std::string& id) {
    return services.wellknown.isLookupWhitelistedFromCodeSignIdentifier(client, c, id);
  }

  // May the client reach this container?
  VSAErrorRef checkAccess() {
    const std::string& bundle = grants.clientIdentifier;
    VSAContainerClass c = identity.containerClass();
    const std::string& id = identity.identifier();
    bool entitledLookup = grants.isEntitledForLookupWithClass(c, id);
    bool allowed = id == bundle || grants.allowOtherIdLookup ||
                   (VSAContainerClassIsGroup(c) && grants.allowGroupIdLookup) ||
                   grants.unrestricted || entitledLookup || whitelisted(bundle, c, id);
    if (!allowed)
      return failure(VSAResult::kNotEntitled, nullptr,
                     VSAFormat("%@ not entitled to retrieve container class %ld with identifier %@",
                               bundle, static_cast<long>(c), id));
    if (c == VSAClass::kSystemData && !grants.allowOtherIdLookup && !grants.unrestricted &&
        !entitledLookup) {
      bool passes = whitelisted(bundle, VSAClass::kSystemData, id) ||
                    (id == bundle && services.codeSigning.identifierHasSystemContainer(id));
      if (!passes)
        return failure(
            VSAResult::kNotEntitled, nullptr,
            VSAFormat("%@ not entitled for system container with identifier %@", bundle, id));
    }
    return nullptr;
  }

  std::string liveName(const std::string& uuidName) {
    VSAContainerClass c = identity.containerClass();
    if (VSAContainerClassIsSystem(c))
      if (auto name = services.wellknown.wellknownContainerForId(identity.identifier(), c))
        return *name;
    return uuidName;
  }

  // Step 8: a new container, assembled in staging and renamed into place.
  VSAMetadataRef create(VSAErrorRef* error) {
    VSAContainerClass c = identity.containerClass();
    const auto& user = identity.userIdentity();
    auto& config = *services.configuration;
    std::string name = VSAUUID::random().string();
    VSALog(kVSALogInfo, kOrigin, "CreatingContainer uuid=%@ identifier=%@ class=%llu", name,
           identity.identifier(), static_cast<unsigned long long>(c));
    std::string staging = VSAPathJoin(config.stagingDirectoryURLForUserIdentity(user, c), name);
    VSAErrorRef underlying;
    if (!VSAContainerDirectories(services)._createTopLevelContainerDirectory(
            staging, c, user->posixUIDForContainerClass(c), user->posixGIDForContainerClass(c),
            &underlying)) {
      *error = failure(VSAResult::kStagingCreateFailed, underlying,
                       VSAFormat("Failed to create staging dir at %@ : %@", staging, underlying));
      // The directory may exist although a later step of its creation (its
      // protection class, its owner) failed; its name is fresh, so it is ours.
      discard(staging, error);
      return nullptr;
    }
    // Where the new container is: in staging until it has been renamed into place.
    std::string made = staging;
    VSAMetadataRef metadata = assemble(staging, name, &made, error);
    if (!metadata) discard(made, error);
    return metadata;
  }

  // Nothing of a failed creation stays outside death row. A directory that
  // is not there (its mkdir failed) is no failure.
  void discard(const std::string& directory, VSAErrorRef* error) {
    VSAErrorRef cleanup;
    if (!services.deathRow->_moveItemAtURLToDeathRow(directory, {.startDeletionThread = true},
                                                     &cleanup))
      *error = failure(VSAResult::kStagingRemovalFailed, *error,
                       VSAFormat("Failed to remove staging dir: %@", directory));
  }

  VSAMetadataRef assemble(const std::string& staging, const std::string& name, std::string* made,
                          VSAErrorRef* error) {
    VSAContainerClass c = identity.containerClass();
    auto& config = *services.configuration;
    VSAResultCode code = VSAResult::kSuccess;
    auto concrete = VSAConcreteContainerIdentity::containerIdentityWithUUID(
        VSAUUID::random(), identity.userIdentity(), identity.identifier(), c, &code);
    if (!concrete) {
      *error = failure(code, nullptr, VSAFormat("Failed to make identity for %@", identity));
      return nullptr;
    }
    auto metadata = std::make_shared<VSAMetadata>(concrete, std::nullopt, staging, std::nullopt);
    if (!metadata->writeMetadataToDiskWithError(config, error)) return nullptr;
    if (VSAContainerClassIsSystem(c) &&
        !services.fileManager->setTopLevelSystemContainerACLAtURL(staging, error))
      return nullptr;
    std::vector<std::string> subdirectories;
    if (!VSAContainerDirectories(services)._createSubDirectories(staging, *metadata, error, false,
                                                                 &subdirectories))
      return nullptr;
    auto base = config.containerDirectoryURLForUserIdentity(identity.userIdentity(), c, transient);
    std::string live = VSAPathJoin(base.value_or(""), liveName(name));
    VSAErrorRef underlying;
    // The rename below commits the container's own entry; the directories
    // made inside it are durable only once the directories holding them
    // (known: no listing of the tree) have been synced.
    if (!services.fileManager->syncDirectoriesHoldingAtURL(staging, subdirectories, &underlying)) {
      *error = failure(VSAResult::kStagingMoveFailed, underlying,
                       VSAFormat("Failed to sync staging dir: %@", staging));
      return nullptr;
    }
    services.testLocks->waitOnLock(kVSATestLockCreate);
    if (!base || !services.fileManager->moveItemAtURL(staging, live, &underlying)) {
      *error = failure(VSAResult::kStagingMoveFailed, underlying,
                       VSAFormat("Failed to move staging dir: %@ to live dir: %@", staging, live));
      return nullptr;
    }
    *made = live;
    if (services.deviceProperties->isFeatureEnabled("fast_container_sizing"))
      services.fileManager->fastDiskUsageForURL(live);
    metadata->setUrl(live);
    metadata->setExisted(false);
    metadata->setTransient(transient);
    if (!services.containerCache->addContainerMetadata(
            *metadata, live, {.transient = transient, .updateSandbox = true}, &underlying)) {
      *error = failure(VSAResult::kCacheAddFailed, underlying,
                       VSAFormat("Failed to add to cache : %@, url: %@, transient: %d", *metadata,
                                 live, transient));
      // The container is complete on disk but unknown to the cache; the caller
      // sends it to death row from where it is, so that no later creation of
      // the identity finds a twin in the class directory.
      return nullptr;
    }
    return metadata;
  }
};
}  // namespace

VSAMetadataRef VSAContainerLookup::createOrLookupContainerWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSALookupOptions options, VSAResultCode* withError) {
  const bool createIfNecessary = options.createIfNecessary, transient = options.transient;
  // The identity's description is built only when the line is kept (every look-up passes here).
  if (VSALogger::enabled(kVSALogDebug))
    VSALog(kVSALogDebug, kOrigin,
           "createOrLookup; identity: %@, createIfNecessary: %d, transient: %d, "
           "allowOtherIdLookup: %d, unrestricted: %d, clientBundleIdentifier: %@",
           identity ? identity->description() : std::string("(null)"), createIfNecessary, transient,
           grants_.allowOtherIdLookup, grants_.unrestricted, grants_.clientIdentifier);
  if (!identity) {
    VSALog(kVSALogError, kOrigin, "Cannot lookup a nil container identity.");
    VSASetCode(withError, VSAResult::kOutOfRange);
    return nullptr;
  }
  CreateSteps steps{services_, grants_, *identity, transient};
  VSAErrorRef error = steps.checkAccess();
  VSAMetadataRef found;
  GlobalLock lock(*services_.locks, options.useLocking);
  try {
    if (!error && !transient) {
      lock.acquire(false);
      found = services_.containerCache->containerForContainerIdentity(
          *identity, {.updateSandbox = true, .allowKernelLookup = !grants_.clientIsKernel}, &error);
      if (found) found->setExisted(true);
      if (isNotFound(error)) error = nullptr;
      lock.release();
    }
    if (!found && !error && !createIfNecessary)
      error =
          failure(VSAResult::kContainerNotFound, nullptr,
                  VSAFormat("Container with identifier: \"%@\" Not Found", identity->identifier()));
    if (!found && !error) {
      lock.acquire(true);
      found = services_.containerCache->containerForContainerIdentity(
          *identity,
          {.transient = transient,
           .updateSandbox = true,
           .allowKernelLookup = !grants_.clientIsKernel},
          &error);
      if (isNotFound(error)) error = nullptr;
      if (found && !transient) {
        found->setExisted(true);
      } else if (!error) {
        // A transient container is always made fresh.
        VSAErrorRef moveError;
        if (found && !services_.deathRow->_moveItemAtURLToDeathRow(
                         found->url(), {.startDeletionThread = true}, &moveError)) {
          error = failure(VSAResult::kTransientRemovalFailed, moveError,
                          VSAFormat("Failed to remove transient container at %@", found->url()));
        } else {
          VSAErrorRef cacheError;
          if (found && !services_.containerCache->removeContainerForUserIdentity(
                           found->userIdentity(), found->containerClass(), found->identifier(),
                           true, &cacheError))
            // The new container's entry takes the old one's place in the map.
            VSALog(kVSALogError, kOrigin,
                   "Failed to drop transient container %@ from the cache: %@", found->url(),
                   cacheError);
          found = steps.create(&error);
        }
      }
    }
  } catch (const std::exception& e) {
    if (services_.configuration->isInternalImage()) std::terminate();
    error = failure(VSAResult::kExceptionInTransaction, nullptr,
                    VSAFormat("Got exception: %@ : %@", "std::exception", e.what()));
    found = nullptr;
  }
  if (error) {
    VSASetCode(withError, error->resultCode(VSAResult::kStagingCreateFailed));
    return nullptr;
  }
  return found;
}

std::optional<std::vector<VSAConstMetadataRef>> VSAContainerLookup::containersWithClass(
    VSAContainerClass containerClass, bool transient, VSAResultCode* withError) {
  VSAUserIdentityRef user = grants_.clientUserIdentity;
  if (!user) user = services_.userIdentityCache->defaultUserIdentity();
  VSAAllIdentifiersLockGuard lock(*services_.locks, false);
  VSAErrorRef error;
  auto all = services_.containerCache->allContainersForUserIdentity(
      user, containerClass, {.transient = transient}, &error);
  if (!all) {
    VSALog(kVSALogError, __func__, "Failed to list containers of class %llu: %@",
           static_cast<unsigned long long>(containerClass), error);
    VSASetCode(withError, error ? error->resultCode(VSAResult::kContainerNotFound)
                                : VSAResult::kContainerNotFound);
    return std::nullopt;
  }
  // Without a grant for other identifiers a client sees only its own and
  // those its lookup entitlement lists.
  if (!grants_.allowOtherIdLookup && !grants_.unrestricted) {
    std::erase_if(*all, [&](const VSAConstMetadataRef& m) {
      return m->identifier() != grants_.clientIdentifier &&
             !grants_.isEntitledForLookupWithClass(containerClass, m->identifier());
    });
  }
  return all;
}

VSAMetadataRef VSAContainerLookup::metadataWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  VSAMetadataRef found = createOrLookupContainerWithContainerIdentity(identity, {}, withError);
  if (!found) return nullptr;
  // Re-read under the identifier lock so that a concurrent info change is seen whole.
  VSAIdentifierLockGuard lock(*services_.locks, VSAValue(found->uuid().string()), false);
  VSAErrorRef error;
  auto fresh = VSAMetadata::rereadMetadataOfCachedContainer(*found, *services_.configuration,
                                                            *services_.userIdentityCache, &error);
  if (!fresh) {
    VSASetCode(withError, error ? error->resultCode(VSAResult::kMetadataUnreadable)
                                : VSAResult::kMetadataUnreadable);
    return nullptr;
  }
  fresh->setExisted(true);
  return fresh;
}

VSAMetadataRef VSAContainerLookup::containerForIdentity(VSAContainerCache& cache,
                                                        const VSAContainerIdentity& identity) {
  const VSAUUID* uuid = identity.isConcrete()
                            ? &static_cast<const VSAConcreteContainerIdentity&>(identity).uuid()
                            : nullptr;
  for (bool transient : {false, true}) {
    auto m = cache.containerForContainerIdentity(identity, {.transient = transient}, nullptr);
    if (m && (!uuid || m->uuid() == *uuid)) {
      m->setTransient(transient);
      return m;
    }
    if (!uuid) break;
  }
  return nullptr;
}

std::optional<uint64_t> VSAContainerLookup::diskUsageWithContainerIdentity(
    const VSAContainerIdentityRef& identity, VSAResultCode* withError) {
  VSAMetadataRef found = createOrLookupContainerWithContainerIdentity(identity, {}, withError);
  if (!found) return std::nullopt;
  // The container keeps its place while it is measured.
  VSAIdentifierLockGuard lock(*services_.locks, VSAValue(found->uuid().string()), false);
  auto& fm = *services_.fileManager;
  if (services_.deviceProperties->isFeatureEnabled("fast_container_sizing"))
    return fm.fastDiskUsageForURL(found->url());
  return fm.diskUsageForURL(found->url());
}
