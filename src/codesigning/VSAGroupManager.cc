#include "codesigning/VSAGroupManager.h"

#include <exception>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSACommandStageForDelete.h"

namespace {
constexpr const char* kOrigin = "VSAGroupManager";

template <typename... A>
void logGroups(int level, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::CodeSignMapping, level, kOrigin, format, args...);
}
}  // namespace

VSAGroupManager::VSAGroupManager(
    std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
    std::shared_ptr<VSACodeSigningMapping> mapping,
    std::shared_ptr<VSAContainerCache> containerCache,
    std::shared_ptr<VSAGlobalConfiguration> configuration,
    std::shared_ptr<const VSAStageForDeleteEnvironment> stageEnvironment)
    : userIdentityCache_(std::move(userIdentityCache)),
      mapping_(std::move(mapping)),
      containerCache_(std::move(containerCache)),
      configuration_(std::move(configuration)),
      stageEnvironment_(std::move(stageEnvironment)) {}

std::optional<std::vector<std::string>>
VSAGroupManager::groupContainerIdentifiersForOwnerIdentifier(const VSAValue* owner,
                                                             VSAContainerClass groupContainerClass,
                                                             bool useLocking,
                                                             VSAResultCode* withError) {
  const char* fn = "groupContainerIdentifiersForOwnerIdentifier";
  if (!owner || !owner->isString()) {
    VSALogIn(VSALogCategory::CodeSignMapping, kVSALogError, fn,
             "Can't act on an invalid object: ID: %@",
             owner ? owner->description() : std::string("(null)"));
    VSASetCode(withError, VSAResult::kInvalidArgument);
    return std::nullopt;
  }
  // Held for writing: the owner's groups are read while no container
  // operation, reading or writing, is in flight.
  VSAAllIdentifiersLockGuard lock(*stageEnvironment_->locks, true, useLocking);
  try {
    const std::string& id = *owner->stringValue();
    auto ids = groupContainerClass == VSAClass::kSystemGroup
                   ? mapping_->systemGroupIdentifiersForIdentifier(id)
                   : mapping_->appGroupIdentifiersForIdentifier(id);
    return ids.value_or(std::vector<std::string>{});
  } catch (const std::exception& e) {
    VSALogIn(VSALogCategory::CodeSignMapping, kVSALogError, fn, "Got exception: %@ : %@",
             "std::exception", e.what());
    VSASetCode(withError, VSAResult::kExceptionInTransaction);
    return std::nullopt;
  }
}

void VSAGroupManager::reconcileGroupContainersOfType(int groupType, VSACommandQueue& commandQueue) {
  auto counts = mapping_->copyReferenceCountSetOfType(groupType);
  if (!counts) {
    logGroups(kVSALogError, "Failed to get reference count information for group type: %ld",
              static_cast<long>(groupType));
    return;
  }
  if (groupType == kVSAGroupTypeSystem) {
    _cleanupUnreferencedGroupContainersForUserIdentity(
        userIdentityCache_->defaultUserIdentity(), VSAClass::kSystemGroup, *counts, commandQueue);
    return;
  }
  userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const VSAUserIdentityRef& user) {
        auto perUser = configuration_->getPerUserConfigurationForUserIdentity(user);
        if (perUser && perUser->existsUserBaseDirectory())
          _cleanupUnreferencedGroupContainersForUserIdentity(user, VSAClass::kAppGroup, *counts,
                                                             commandQueue);
      });
}

void VSAGroupManager::_cleanupUnreferencedGroupContainersForUserIdentity(
    const VSAUserIdentityRef& user, VSAContainerClass containerClass,
    const VSAReferenceCounts& referenceCounts, VSACommandQueue& commandQueue) {
  VSAErrorRef error;
  auto all = containerCache_->allContainersForUserIdentity(user, containerClass, {}, &error);
  if (!all) {
    logGroups(kVSALogError, "Failed to fetch group container list for %@: %@", user, error);
    return;
  }
  for (const auto& m : *all) {
    auto it = referenceCounts.find(m->identifier());
    long count = it == referenceCounts.end() ? 0 : it->second;
    if (count > 0) {
      logGroups(kVSALogDebug, "Keeping group container %@ for %@: %ld references", m->identifier(),
                user, count);
      continue;
    }
    logGroups(kVSALogNotice, "Removing group container %@ for %@ at %@", m->identifier(), user,
              m->url());
    std::string id = m->identifier(), who = user->identifier();
    commandQueue.insertCommand(
        VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            stageEnvironment_, {m->containerIdentity()}, false, [id, who](VSAResultCode c) {
              logGroups(kVSALogError,
                        "Failed to destroy group container with identifier %@ for %@: %llu", id,
                        who, c);
            }));
  }
}
