// Content inside a container that clients name by relative paths: the
// user-managed assets directory (path, deletion of one asset) and staging
// of shared content from an identifier's bundle into its data container.
//
// Containers are found as a look-up (55 for a container the client may not
// reach, 21 when there is none) and worked on under their identifier locks
// (writing), re-checked once locked (21 if replaced meanwhile).
//
// Client paths are hostile: they must be relative and safe component by
// component (no "..", ".", empty components or NUL; 11 otherwise). The file
// system layer refuses any link met on the way (11); staging paths are
// also resolved with the file manager's client-path rules and must stay
// strictly inside their container.
//
// On disk:
//  - the user-managed assets directory is "UserManagedAssets" at the top of
//    the container (the metadata's `userManagedAssetsDirName` once it has
//    been made), owned by the container's owner, mode 0755. It is made
//    first and then recorded in the metadata file, so a crash between the
//    two leaves a directory that the next request adopts.
//  - deleting an asset moves the item named (a link itself, not its target)
//    to death row; a missing asset is success; the assets directory itself
//    cannot be named.
//  - staged shared content is copied (cloned where the file system can,
//    walked by descriptor, on one device) from the bundle container
//    (class 1) into the data container's staging directory, given to the
//    owner of the data container's directory, then renamed into place: it
//    lands whole or not at all. Missing directories of the destination are
//    made through the container's descriptor and belong to that owner too.
//    Content already at the destination is exchanged with the new in one
//    step and then goes to death row, so the destination never goes
//    missing. A regular source file that changes while it is copied fails
//    the request (34) and nothing lands. Leftovers of a crash stay in
//    staging, which keeper cleanup empties.
#pragma once

#include <optional>
#include <string>

#include "base/VSAError.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAMetadata.h"
#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

inline constexpr const char* kVSAUserManagedAssetsDirName = "UserManagedAssets";

class VSAContainerContent {
 public:
  VSAContainerContent(const VSAOperationServices& services, const VSAOperationGrants& grants)
      : services_(services), grants_(grants) {}

  // The assets directory's path (relative to the container, or absolute);
  // `existed` tells whether it was there before the call. Without
  // `createIfNecessary` a missing directory is not made: its path is
  // answered with `existed` NO.
  [[nodiscard]] std::optional<std::string> userManagedAssetsPathWithContainerIdentity(
      const VSAContainerIdentityRef& identity, bool isRelative, bool createIfNecessary,
      bool* existed, VSAResultCode* withError);
  [[nodiscard]] bool deleteUserManagedAssetWithContainerIdentity(
      const VSAContainerIdentityRef& identity, const std::string& relativePath,
      VSAResultCode* withError);
  // Answers the destination's absolute path.
  [[nodiscard]] std::optional<std::string> stageSharedContentForIdentifier(
      const std::string& identifier, const VSAUserIdentityRef& userIdentity,
      const std::string& sourceRelativePath, const std::string& destRelativePath,
      VSAResultCode* withError);

 private:
  [[nodiscard]] VSAMetadataRef find(const VSAContainerIdentityRef& identity,
                                    VSAResultCode* withError);
  // The container again, under its lock: 21 when it is not the one found.
  [[nodiscard]] VSAMetadataRef recheck(const VSAMetadata& found, VSAResultCode* withError);
  [[nodiscard]] std::optional<std::string> resolve(const std::string& base,
                                                   const std::string& relativePath,
                                                   const char* origin, VSAResultCode* withError);
  std::string assetsDirectory(const VSAMetadata& container) const;
  [[nodiscard]] bool recordAssetsDirectory(VSAMetadata& container, VSAResultCode* withError);
  [[nodiscard]] bool copyIntoPlace(const VSAMetadata& data, const std::string& source,
                                   const std::string& destination, VSAResultCode* withError);

  const VSAOperationServices& services_;
  const VSAOperationGrants& grants_;
};
