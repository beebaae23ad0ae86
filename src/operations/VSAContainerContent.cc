#include "operations/VSAContainerContent.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "base/VSALocks.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSATestLocks.h"
#include "base/VSAUUID.h"
#include "operations/VSAContainerLookup.h"
#include "platform/VSAUniqueFd.h"

namespace {

bool fail(const char* origin, VSAResultCode code, VSAResultCode* cell, const std::string& message) {
  VSALog(kVSALogError, origin, "%@", message);
  VSASetCode(cell, code);
  return false;
}

VSAResultCode codeOf(const VSAErrorRef& error, VSAResultCode fallback) {
  return error ? error->resultCode(fallback) : fallback;
}

// What tells a regular file's content changed under a reader.
bool sameVersion(const struct stat& a, const struct stat& b) {
  return a.st_ino == b.st_ino && a.st_size == b.st_size && a.st_mtim.tv_sec == b.st_mtim.tv_sec &&
         a.st_mtim.tv_nsec == b.st_mtim.tv_nsec && a.st_ctim.tv_sec == b.st_ctim.tv_sec &&
         a.st_ctim.tv_nsec == b.st_ctim.tv_nsec;
}
}  // namespace

VSAMetadataRef VSAContainerContent::find(const VSAContainerIdentityRef& identity,
                                         VSAResultCode* withError) {
  return VSAContainerLookup(services_, grants_)
      .createOrLookupContainerWithContainerIdentity(identity, {}, withError);
}

VSAMetadataRef VSAContainerContent::recheck(const VSAMetadata& found, VSAResultCode* withError) {
  auto now = VSAContainerLookup::containerForIdentity(*services_.containerCache,
                                                      *found.containerIdentity());
  if (!now)
    fail("recheck", VSAResult::kContainerNotFound, withError,
         VSAFormat("Container %@ went away", found.url()));
  return now;
}

std::optional<std::string> VSAContainerContent::resolve(const std::string& base,
                                                        const std::string& relativePath,
                                                        const char* origin,
                                                        VSAResultCode* withError) {
  if (!VSAIsSafeRelativePath(relativePath)) {
    fail(origin, VSAResult::kInvalidArgument, withError,
         VSAFormat("Invalid relative path: %@", VSAClientStringForLog(relativePath)));
    return std::nullopt;
  }
  auto resolved = services_.fileManager->realPathForURL(VSAPathJoin(base, relativePath), base);
  if (!resolved)
    fail(origin, VSAResult::kInvalidArgument, withError,
         VSAFormat("Path %@ does not stay inside %@", VSAClientStringForLog(relativePath), base));
  return resolved;
}

std::string VSAContainerContent::assetsDirectory(const VSAMetadata& container) const {
  const auto& name = container.userManagedAssetsDirName();
  // A recorded name is used only when it still is a plain name.
  bool usable = name && VSAIsSafeFileName(*name);
  return VSAPathJoin(container.url(), usable ? *name : kVSAUserManagedAssetsDirName);
}

bool VSAContainerContent::recordAssetsDirectory(VSAMetadata& container, VSAResultCode* withError) {
  VSAErrorRef error;
  auto fresh = VSAMetadata::rereadMetadataOfCachedContainer(container, *services_.configuration,
                                                            *services_.userIdentityCache, &error);
  if (!fresh)
    return fail("recordAssetsDirectory", codeOf(error, VSAResult::kMetadataUnreadable), withError,
                VSAFormat("Failed to read metadata of %@: %@", container.url(), error));
  fresh->setUserManagedAssetsDirName(std::string(kVSAUserManagedAssetsDirName));
  if (!fresh->writeMetadataToDiskWithError(*services_.configuration, &error)) {
    VSASetCode(withError, codeOf(error, VSAResult::kWriteFailed));
    return false;
  }
  if (!services_.containerCache->addContainerMetadata(
          *fresh, fresh->url(), {.transient = fresh->transient(), .updateSandbox = true}, &error))
    return fail("recordAssetsDirectory", VSAResult::kCacheAddFailed, withError,
                VSAFormat("Failed to add to cache: %@", *fresh));
  return true;
}

std::optional<std::string> VSAContainerContent::userManagedAssetsPathWithContainerIdentity(
    const VSAContainerIdentityRef& identity, bool isRelative, bool createIfNecessary, bool* existed,
    VSAResultCode* withError) {
  const char* origin = "userManagedAssetsPathWithContainerIdentity";
  auto found = find(identity, withError);
  if (!found) return std::nullopt;
  VSAIdentifierLockGuard lock(*services_.locks, VSAValue(found->uuid().string()), true);
  auto container = recheck(*found, withError);
  if (!container) return std::nullopt;
  std::string directory = assetsDirectory(*container);
  auto& fm = *services_.fileManager;
  struct stat st {};
  int rc = fm.fileSystem().lstat(directory, &st);
  if (rc == 0 && !S_ISDIR(st.st_mode)) {
    fail(origin, VSAResult::kInvalidArgument, withError,
         VSAFormat("%@ is in the way of the user-managed assets directory", directory));
    return std::nullopt;
  }
  *existed = rc == 0;
  if (!*existed && createIfNecessary) {
    VSAContainerClass c = container->containerClass();
    const auto& owner = container->userIdentity();
    VSAErrorRef error;
    if (!fm.createDirectoryAtURL(directory, false, 0755, owner->posixUIDForContainerClass(c),
                                 kVSANoProtectionClass, &error,
                                 owner->posixGIDForContainerClass(c))) {
      fail(origin, codeOf(error, VSAResult::kWriteFailed), withError,
           VSAFormat("Failed to create user-managed assets directory %@: %@", directory, error));
      return std::nullopt;
    }
  }
  bool recorded = container->userManagedAssetsDirName().has_value();
  if ((*existed || createIfNecessary) && !recorded && !recordAssetsDirectory(*container, withError))
    return std::nullopt;
  return isRelative ? VSALastPathComponent(directory) : directory;
}

bool VSAContainerContent::deleteUserManagedAssetWithContainerIdentity(
    const VSAContainerIdentityRef& identity, const std::string& relativePath,
    VSAResultCode* withError) {
  const char* origin = "deleteUserManagedAssetWithContainerIdentity";
  if (!VSAIsSafeRelativePath(relativePath))
    return fail(origin, VSAResult::kInvalidArgument, withError,
                VSAFormat("Invalid relative path: %@", VSAClientStringForLog(relativePath)));
  auto found = find(identity, withError);
  if (!found) return false;
  VSAIdentifierLockGuard lock(*services_.locks, VSAValue(found->uuid().string()), true);
  auto container = recheck(*found, withError);
  if (!container) return false;
  std::string base = assetsDirectory(*container);
  auto& fm = *services_.fileManager;
  // The item named goes, a link itself rather than what it points to; the
  // file system refuses a link on the way (ELOOP) or a file used as a
  // directory (ENOTDIR).
  auto asset = std::optional<std::string>(VSAPathJoin(base, relativePath));
  struct stat st {};
  int rc = fm.fileSystem().lstat(*asset, &st);
  if (rc == ENOENT) return true;  // already gone, or no assets at all
  if (rc != 0)
    return fail(origin, VSAResult::kInvalidArgument, withError,
                VSAFormat("Asset %@ cannot be reached: %s", VSAClientStringForLog(relativePath),
                          std::strerror(rc)));
  VSAErrorRef error;
  if (!services_.deathRow->_moveItemAtURLToDeathRow(*asset, {.startDeletionThread = true}, &error))
    return fail(origin, codeOf(error, VSAResult::kDeathRowMoveFailed), withError,
                VSAFormat("Failed to move asset %@ to death row: %@", *asset, error));
  VSALog(kVSALogNotice, origin, "Deleted user-managed asset %@", *asset);
  return true;
}

std::optional<std::string> VSAContainerContent::stageSharedContentForIdentifier(
    const std::string& identifier, const VSAUserIdentityRef& userIdentity,
    const std::string& sourceRelativePath, const std::string& destRelativePath,
    VSAResultCode* withError) {
  const char* origin = "stageSharedContentForIdentifier";
  for (const std::string* path : {&sourceRelativePath, &destRelativePath})
    if (!VSAIsSafeRelativePath(*path)) {
      fail(origin, VSAResult::kInvalidArgument, withError,
           VSAFormat("Invalid relative path: %@", VSAClientStringForLog(*path)));
      return std::nullopt;
    }
  VSAResultCode code = VSAResult::kSuccess;
  auto bundleIdentity = VSAContainerIdentity::containerIdentityWithUserIdentity(
      userIdentity, identifier, VSAClass::kBundleApplication, &code);
  auto dataIdentity = VSAContainerIdentity::containerIdentityWithUserIdentity(
      userIdentity, identifier, VSAClass::kDataApplication, &code);
  if (!bundleIdentity || !dataIdentity) {
    VSASetCode(withError, code);
    return std::nullopt;
  }
  auto bundleFound = find(bundleIdentity, withError);
  auto dataFound = bundleFound ? find(dataIdentity, withError) : nullptr;
  if (!dataFound) return std::nullopt;
  VSAIdentifierLockGuard lock(*services_.locks,
                              VSAValue(VSAValue::Array{VSAValue(bundleFound->uuid().string()),
                                                       VSAValue(dataFound->uuid().string())}),
                              true);
  auto bundle = recheck(*bundleFound, withError);
  auto data = bundle ? recheck(*dataFound, withError) : nullptr;
  if (!data) return std::nullopt;
  auto source = resolve(bundle->url(), sourceRelativePath, origin, withError);
  auto destination =
      source ? resolve(data->url(), destRelativePath, origin, withError) : std::nullopt;
  if (!destination) return std::nullopt;
  if (!copyIntoPlace(*data, *source, *destination, withError)) return std::nullopt;
  VSALog(kVSALogNotice, origin, "Staged %@ into %@", *source, *destination);
  return destination;
}

bool VSAContainerContent::copyIntoPlace(const VSAMetadata& data, const std::string& source,
                                        const std::string& destination, VSAResultCode* withError) {
  const char* origin = "stageSharedContentForIdentifier";
  auto& fm = *services_.fileManager;
  auto& fs = fm.fileSystem();
  struct stat before {
  }, after{};
  if (fs.lstat(source, &before) != 0)
    return fail(origin, VSAResult::kInvalidArgument, withError,
                VSAFormat("Source %@ does not exist", source));
  // What lands in the container is given to the container's owner, as the
  // directory it lands in says: opened once, and the missing directories
  // of the destination are made through it.
  std::string prefix = VSAPathJoin(data.url(), "");
  if (destination.rfind(prefix, 0) != 0)
    return fail(origin, VSAResult::kInvalidArgument, withError,
                VSAFormat("Destination %@ is not inside %@", destination, data.url()));
  int raw = -1;
  int rc = fs.openDirectory(data.url(), &raw);
  VSAUniqueFd container(raw);
  struct stat owner {};
  if (rc == 0) rc = fs.statAt(container.get(), "", &owner);
  if (rc != 0)
    return fail(origin, VSAResult::kWriteFailed, withError,
                VSAFormat("Failed to open %@: %s", data.url(), std::strerror(rc)));
  uid_t uid = owner.st_uid;
  gid_t gid = owner.st_gid;
  std::string staging = VSAPathJoin(services_.configuration->stagingDirectoryURLForUserIdentity(
                                        data.userIdentity(), data.containerClass()),
                                    VSAUUID::random().string());
  VSAErrorRef error;
  auto discard = [&](VSAResultCode code, const std::string& message) {
    VSAErrorRef cleanup;
    fm.removeItemAtURL(staging, &cleanup);
    return fail(origin, code, withError, message);
  };
  if (!fm.copyItemAtURL(source, staging, &error))
    return discard(codeOf(error, VSAResult::kWriteFailed),
                   VSAFormat("Failed to copy %@ to %@: %@", source, staging, error));
  if (S_ISREG(before.st_mode) && (fs.lstat(source, &after) != 0 || !sameVersion(before, after)))
    return discard(VSAResult::kWriteFailed,
                   VSAFormat("Source %@ changed while it was copied", source));
  if (!fm.standardizeOwnershipAtURL(staging, uid, gid, &error))
    return discard(codeOf(error, VSAResult::kWriteFailed),
                   VSAFormat("Failed to give %@ to %u: %@", staging, uid, error));
  // The commit below (a rename or an exchange) makes the staged item's own
  // entry durable, not the entries copied below it.
  if (!fm.syncDirectoriesAtURL(staging, &error))
    return discard(codeOf(error, VSAResult::kWriteFailed),
                   VSAFormat("Failed to sync %@: %@", staging, error));
  std::string parent = VSADirectoryName(destination.substr(prefix.size()));
  if (!parent.empty() && !fm.createDirectoriesAt(container.get(), parent, 0755, uid, gid, &error))
    return discard(codeOf(error, VSAResult::kWriteFailed),
                   VSAFormat("Failed to create %@ in %@: %@", parent, data.url(), error));
  struct stat existing {};
  if (fs.lstat(destination, &existing) != 0) {
    if (!fm.moveItemAtURL(staging, destination, &error))
      return discard(codeOf(error, VSAResult::kWriteFailed),
                     VSAFormat("Failed to move %@ to %@: %@", staging, destination, error));
    return true;
  }
  // The old content keeps its place until the new takes it in one step.
  if (!fm.exchangeItemsAtURL(staging, destination, &error))
    return discard(codeOf(error, VSAResult::kWriteFailed),
                   VSAFormat("Failed to exchange %@ and %@: %@", staging, destination, error));
  // The old content is in staging now: death row takes it, or the next cleanup does.
  if (!services_.deathRow->_moveItemAtURLToDeathRow(staging, {.startDeletionThread = true}, &error))
    VSALog(kVSALogError, origin, "Failed to move replaced %@ to death row: %@", staging, error);
  return true;
}
