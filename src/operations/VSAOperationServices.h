// The services the container operations work with: the directory layout,
// the file manager, the container cache, death row, the user identities and
// the host's per-class sub-directory list, plus the few answers they need
// from code signing, the whitelist and data protection, passed as functions
// so that operations stay below those modules. Built once per daemon
// instance (see the daemon context) and shared read-only by every request;
// each member is itself thread-safe.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "model/VSAContainerCache.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSADeathRow.h"
#include "operations/VSAStageForDeleteEnvironment.h"
#include "platform/VSAContainerSubdirectories.h"
#include "platform/VSADeviceProperties.h"
#include "platform/VSAFileManager.h"
#include "platform/VSATransactions.h"

struct VSAOperationServices {
  std::shared_ptr<VSAGlobalConfiguration> configuration;
  std::shared_ptr<VSAFileManager> fileManager;
  std::shared_ptr<VSAContainerCache> containerCache;
  std::shared_ptr<VSADeathRow> deathRow;
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache;
  std::shared_ptr<VSAContainerSubdirectories> subdirectories;
  std::shared_ptr<VSADeviceProperties> deviceProperties;
  std::shared_ptr<VSATransactions> transactions;
  std::shared_ptr<VSAStageForDeleteEnvironment> stageEnvironment;

  // Whitelist: may `client` look up (class, identifier) without a grant?
  std::function<bool(const std::string& client, VSAContainerClass, const std::string& identifier)>
      isLookupWhitelisted;
  // Whitelist: the directory name of a well-known system (group) container.
  std::function<std::optional<std::string>(const std::string& identifier, VSAContainerClass)>
      wellknownContainerForId;
  // Code signing: does the identifier's entitlement ask for a system container?
  std::function<bool(const std::string& identifier)> identifierHasSystemContainer;
  // Code signing: forget the cached information of an identifier and its children.
  std::function<bool(const std::string& identifier, VSAErrorRef* error)>
      invalidateCodeSigningInfoForIdentifierAndItsChildren;
  // Groups: the group identifiers an owner identifier is entitled to, for a
  // group container class (7 or 13); nothing (and the code) on failure.
  std::function<std::optional<std::vector<std::string>>(
      const std::string& owner, VSAContainerClass groupClass, VSAResultCode* error)>
      groupContainerIdentifiersForOwner;
  // Data protection: the class an identifier's entitlements ask for.
  std::function<int32_t(const std::string& identifier)> intendedDataProtectionClass;
  // Groups: queue the deletion of application group containers no identifier references.
  std::function<void(VSACommandQueue& queue)> reconcileApplicationGroups;
  // Code signing: drop the advance copies of code-signing entries.
  std::function<bool(VSAErrorRef* error)> removeAllAdvanceCopies;
  // Data protection: restart the changes persisted before the last stop.
  std::function<bool(VSAErrorRef* error)> restartPendingDataProtectionOperations;
};
