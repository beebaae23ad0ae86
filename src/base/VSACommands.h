// Command numbers: what a request asks for.
//
// A request names its command with the number under "Command"; the daemon's
// command table is indexed by it, and the client, the launcher, the load
// generator and the tests send it. Every command: its name here, its number
// (part of the client protocol: never renumbered, never reused) and what it
// does, in one list that the constants and the table of meanings are both
// made from. Constant; thread-safe.
#pragma once

#include <cstddef>
#include <cstdint>
#include <iterator>

using VSACommandNumber = uint64_t;

#define VSA_COMMANDS(X)                                                                  \
  X(kCreateOrLookup, 0, "create or look up a container")                                 \
  X(kListContainers, 1, "list containers of a class")                                    \
  X(kReplaceContainer, 2, "replace a container by another")                              \
  X(kStageForDelete, 3, "stage containers for deletion")                                 \
  X(kDeleteDeathRow, 4, "empty death row (replies from its completion)")                 \
  X(kSetInfoValue, 5, "set a metadata info value")                                       \
  X(kInfoValue, 6, "read a metadata info value")                                         \
  X(kContainerMetadata, 7, "read a container's metadata")                                \
  X(kRecreateDefaultStructure, 8, "recreate a container's default structure")            \
  X(kRegenerateDirectoryUUID, 9, "regenerate a container's directory UUID")              \
  X(kDeleteContainer, 10, "delete a container")                                          \
  X(kWipePluginData, 11, "wipe a plug-in data container's content")                      \
  X(kDeleteContainerContent, 12, "delete a data container's content")                    \
  X(kGroupContainers, 13, "group containers with tokens and personas")                   \
  X(kGroupContainerIdentifiers, 14, "group container identifiers of an owner")           \
  X(kSystemContainerPath, 15, "path of a system container")                              \
  X(kGroupContainerPaths, 16, "group container paths of an owner")                       \
  X(kSystemGroupContainerPath, 17, "path of a system group container")                   \
  X(kRecordCodeSigningInfo, 18, "record code-signing information")                       \
  X(kReadCodeSigningInfo, 19, "read code-signing information")                           \
  X(kInvalidateAppsWithoutBundle, 20, "invalidate apps without bundle")                  \
  X(kSetDataProtection, 21, "change data protection (replies from its completion)")      \
  X(kRestoreDefaultStructure, 22, "recreate a container's default structure, as 8 does") \
  X(kDiskUsage, 23, "disk usage of a container")                                         \
  X(kDataMigration, 24, "data migration")                                                \
  X(kRetryTest, 25, "crash-retry test")                                                  \
  X(kStageSharedContent, 26, "stage shared content")                                     \
  X(kRetired, 27, "retired")                                                             \
  X(kUserManagedAssetsPath, 28, "path of a user-managed assets directory")               \
  X(kDeleteUserManagedAsset, 29, "delete a user-managed asset")                          \
  X(kPerUserDataMigration, 30, "per-user data migration")                                \
  X(kTestLock, 31, "set or clear a test lock")                                           \
  X(kPersonaUniqueStrings, 32, "persona unique strings")

namespace VSACommands {
#define VSA_COMMAND_CONSTANT(name, value, meaning) constexpr VSACommandNumber name = value;
VSA_COMMANDS(VSA_COMMAND_CONSTANT)
#undef VSA_COMMAND_CONSTANT

struct Description {
  VSACommandNumber number;
  const char* name;
  const char* meaning;
};
// Every command, in increasing order.
inline constexpr Description kAll[] = {
#define VSA_COMMAND_DESCRIPTION(name, value, meaning) {value, #name, meaning},
    VSA_COMMANDS(VSA_COMMAND_DESCRIPTION)
#undef VSA_COMMAND_DESCRIPTION
};
inline constexpr size_t kCount = std::size(kAll);
}  // namespace VSACommands
