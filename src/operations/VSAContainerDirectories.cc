#include "operations/VSAContainerDirectories.h"

#include <algorithm>

#include "base/VSALog.h"
#include "base/VSAPathString.h"

namespace {}

int32_t VSAContainerDirectories::_dataProtectionClassForContainerMetadata(
    const VSAMetadata& metadata) {
  if (!VSAContainerClassIsPerUser(metadata.containerClass())) return 0;
  const VSAValue* recorded =
      metadata.info() ? metadata.info()->get(kVSAContentProtectionClassInfoKey) : nullptr;
  if (recorded && recorded->isInteger())
    return static_cast<int32_t>(recorded->int64Value().value_or(0));
  return services_.dataProtection.intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
      metadata.identifier());
}

bool VSAContainerDirectories::_createTopLevelContainerDirectory(const std::string& url,
                                                                VSAContainerClass c, uid_t owner,
                                                                gid_t group, VSAErrorRef* error) {
  if (VSAContainerClassIsBundle(c))
    owner = CONTAINER_INSTALLATION_UID;
  else if (VSAContainerClassIsSystem(c))
    owner = 0;
  return services_.fileManager->createDirectoryAtURL(url, true, 0755, owner, 0, error, group);
}

bool VSAContainerDirectories::_createSubDirectories(const std::string& url,
                                                    const VSAMetadata& metadata, VSAErrorRef* error,
                                                    bool durable, std::vector<std::string>* made) {
  VSAContainerClass c = metadata.containerClass();
  bool system = VSAContainerClassIsSystem(c);
  mode_t mode = system ? 0 : 0755;
  uid_t owner = VSAContainerClassIsBundle(c) ? CONTAINER_INSTALLATION_UID
                : system                     ? kVSANobodyID
                         : metadata.userIdentity()->posixUIDForContainerClass(c);
  gid_t group = system ? kVSANobodyID : metadata.userIdentity()->posixGIDForContainerClass(c);
  VSAResultCode libraryError = VSAResult::kSuccess;
  auto names = services_.subdirectories->subdirectoriesForClass(c, &libraryError);
  if (!names) {
    auto e = VSA_ERROR(libraryError, "Failed to get subdirectory names for %llu : %llu",
                       static_cast<unsigned long long>(c), libraryError);
    VSALog(kVSALogError, __func__, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  if (made) *made = *names;
  int32_t protection = _dataProtectionClassForContainerMetadata(metadata);
  VSALog(kVSALogDebug, __func__, "Creating subdirectories for [%llu:%@] at [%@]",
         static_cast<unsigned long long>(c), metadata.identifier(), url);
  const auto& excluded = VSAGlobalConfiguration::excludedFromAppUserData();
  auto& fm = *services_.fileManager;
  for (const auto& name : *names) {
    int32_t itemClass = protection;
    if (VSAContainerClassIsPerUser(c) &&
        std::find(excluded.begin(), excluded.end(), name) != excluded.end())
      itemClass = 0;
    std::string path = VSAPathJoin(url, name);
    VSAErrorRef underlying;
    // A system sub-directory made with mode 0 inherits the ACL under a mask
    // of none; setting its ACL again makes the "systemusers" entry count.
    bool made = durable
                    ? fm.createDurableDirectoryAtURL(
                          path, mode, owner, static_cast<uint32_t>(itemClass), &underlying, group)
                    : fm.createDirectoryAtURL(path, true, mode, owner,
                                              static_cast<uint32_t>(itemClass), &underlying, group);
    if (!made || (system && !fm.setSystemContainerDirectoryACLAtURL(path, &underlying))) {
      auto e = VSA_ERROR_UNDERLYING(
          underlying->resultCode(VSAResult::kStagingCreateFailed), underlying,
          "Failed to create sub-dir for %@ at %@ (protClass: %d)", name, url, itemClass);
      VSALog(kVSALogError, __func__, "%@", e->message());
      VSASetError(error, e);
      return false;
    }
  }
  return true;
}
