// What each code-signing identifier's signature and entitlements say, kept
// in the code-signing database, and the container work that follows from
// changes: group containers whose last reference goes and system containers
// no longer entitled are queued for deletion on the caller's command queue
// (never deleted inline), and only once the change is in the database.
//
// Every operation runs on the serial queue "com.tamsk.Vessa.EntitlementQueue":
// public methods enter it synchronously and must not be called from it;
// `_onQueue_` methods assert that they run on it.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/VSALocks.h"
#include "base/VSAValue.h"
#include "base/VSAWorkQueue.h"
#include "codesigning/VSASQLiteDB.h"
#include "model/VSACodeSigningQueries.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"
#include "operations/VSACodeSigningChanges.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSAGroupQueries.h"
#include "operations/VSAStageForDeleteEnvironment.h"

inline constexpr const char* kVSAEntitlementsKey = "com.tamsk.Vessa.Entitlements";
inline constexpr const char* kVSAOptionDataContainerClass = "com.tamsk.Vessa.DataContainerClass";
inline constexpr const char* kVSAOptionParentBundleID = "com.tamsk.Vessa.ParentBundleID";
inline constexpr const char* kVSAOptionRegByCaller = "RegByCaller";
inline constexpr const char* kVSAOptionPlaceholder = "com.tamsk.Vessa.PlaceholderEntitlements";
inline constexpr const char* kVSAOptionAdvanceCopy = "com.tamsk.Vessa.AdvanceCopy";
inline constexpr const char* kVSAEntitlementApplicationGroups =
    "com.tamsk.security.application-groups";
inline constexpr const char* kVSAEntitlementSystemGroups = "com.tamsk.security.system-groups";
inline constexpr const char* kVSAEntitlementSystemGroupContainers =
    "com.tamsk.security.system-group-containers";
inline constexpr const char* kVSAEntitlementSystemContainer = "com.tamsk.security.system-container";

// A counted multiset of group identifiers.
using VSAReferenceCounts = std::map<std::string, int>;

class VSACodeSigningMapping : public VSACodeSigningQueries, public VSACodeSigningChanges {
 public:
  // initWithUserIdentityCache:queue:mappingDB: — also moves a legacy mapping
  // file ("vsa_code_signing_info.plist" in the library directory) into the
  // database, on the mapping's queue.
  VSACodeSigningMapping(std::shared_ptr<VSAUserIdentityCache> userIdentityCache,
                        std::shared_ptr<VSAGlobalConfiguration> configuration,
                        std::unique_ptr<VSASQLiteDB> mappingDB, std::shared_ptr<VSALocks> locks);

  // Registers (or, without `info`, forgets) an identifier's code-signing info.
  VSAResultCode processCodeSigningInfo(const std::optional<VSAValue>& info,
                                       const std::string* identifier, const VSAValue& options,
                                       VSACommandQueue* commandQueue);
  VSAResultCode processCallerRegisteredEntitlements(const VSAValue& entitlements,
                                                    const std::string& identifier,
                                                    VSACommandQueue* commandQueue);
  // For clients: nothing for placeholder, advance-copy or invalid entries.
  std::optional<VSAValue> getCodeSigningInfoForIdentifier(const std::string& identifier);
  std::optional<VSAValue> entitlementsForIdentifier(const std::string& identifier) override;
  std::optional<std::vector<std::string>> appGroupIdentifiersForIdentifier(const std::string& id);
  std::optional<std::vector<std::string>> systemGroupIdentifiersForIdentifier(
      const std::string& id);
  // The system group identifiers an entitlements dictionary grants (prefix-checked).
  static std::optional<std::vector<std::string>> systemGroupIdentifiersFromEntitlements(
      const std::string& id, const VSAValue& entitlements) {
    return systemGroupIds(id, &entitlements, true);
  }
  VSAContainerClass dataContainerTypeForIdentifier(const std::string& identifier);
  bool identifierHasSystemContainer(const std::string& identifier) override;
  bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
  std::optional<VSACodeSigningEntry> codeSigningEntryForIdentifier(const std::string& identifier,
                                                                   VSAErrorRef* error);
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& child) override;
  std::optional<std::vector<std::string>> childBundleIdentifiersForParentIdentifier(
      const std::string& parent);
  std::optional<std::vector<std::string>> identifiersWithError(VSAErrorRef* error);
  bool invalidateCodeSigningInfoForIdentifier(const std::string& identifier, VSAErrorRef* error);
  bool invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                            VSAErrorRef* error) override;
  void removeCodeSigningDictionariesForIdentifierAndItsChildren(
      const std::string& identifier, VSACommandQueue* commandQueue) override;
  bool removeAllAdvanceCopiesWithError(VSAErrorRef* error) override;
  // Invalidates the records of apps (and their plug-ins) that no longer have
  // a bundle container; caller-registered entries and plug-ins with a parent
  // are left alone. 1 when every step succeeded.
  VSAResultCode invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  // Queues deletion of system containers that no entry's entitlements claim.
  void reconcileSystemContainersWithCommandQueue(VSACommandQueue* commandQueue);
  std::optional<VSAReferenceCounts> copyReferenceCountSetOfType(int groupType);

  // Legacy migrations (VSACodeSigningMappingLegacy.cc). Moves the legacy
  // entitlements file ("vsa_entitlements.plist") into the database: every
  // identifier without a valid entry gets one; the file goes once every
  // identifier is in the database, so a failed or interrupted run is redone.
  // True when there was nothing to do or everything moved.
  bool migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
  // Adds `entry` for `identifier` unless the database holds one that is
  // valid (`*kept` set then). `beforeWrite`, when given, runs once the entry
  // is to be written and before the write (the caller's progress line). The
  // caller logs the rest; false on a database failure.
  bool addLegacyEntryUnlessValid(const std::string& identifier, const VSACodeSigningEntry& entry,
                                 bool* kept, VSAErrorRef* error,
                                 const std::function<void()>& beforeWrite = {});

  // Group identifiers from an entitlements dictionary (string or array of
  // strings; duplicates removed); nothing for other shapes (logged).
  static std::optional<std::vector<std::string>> copyApplicationGroupEntitlementForIdentifier(
      const std::string& identifier, const VSAValue* entitlements, const char* groupKey);

  VSAWorkQueue& queue() { return *queue_; }
  // The daemon's lock table, which passes over the mapping take.
  VSALocks& locks() const { return *locks_; }
  // What the deletions this mapping queues run with (set once the container
  // cache exists).
  void setStageForDeleteEnvironment(
      std::shared_ptr<const VSAStageForDeleteEnvironment> environment) {
    stageEnvironment_ = std::move(environment);
  }

 private:
  void _onQueue_migrateFromMappingFileToDBIfNecessary();
  bool _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
  bool _onQueue_addLegacyEntryUnlessValid(const std::string& identifier,
                                          const VSACodeSigningEntry& entry, bool* kept,
                                          VSAErrorRef* error,
                                          const std::function<void()>& beforeWrite);
  VSAResultCode _onQueue_processCodeSigningInfo(const std::optional<VSAValue>& info,
                                                const std::string& identifier,
                                                const VSAValue& options,
                                                const std::optional<VSAValue>& oldEntitlements,
                                                VSACommandQueue* commandQueue);
  VSAResultCode _onQueue_setCodeSigningDictionaryValues(
      const std::vector<std::optional<VSACodeSigningEntry>>& values,
      const std::vector<std::string>& identifiers);
  // Reads an entry; "not found" is no entry and no error.
  VSAResultCode _onQueue_recordCallerEntitlements(const VSAValue& entitlements,
                                                  const std::string& identifier,
                                                  VSACommandQueue* commandQueue);
  std::optional<VSACodeSigningEntry> _onQueue_entry(const std::string& identifier,
                                                    VSAErrorRef* error);
  std::optional<VSAValue> _onQueue_entitlementsForIdentifier(const std::string& identifier);
  std::optional<VSAReferenceCounts> _onQueue_copyReferenceCountSetOfType(int groupType);
  // Hands `block` every entry's group list, read with `key` or, when that
  // gives nothing or an empty list, with `fallBackKey`. False when the
  // enumeration failed (logged).
  bool _onQueue_iterateGroupIdsWithKey(
      const char* key, const char* fallBackKey,
      const std::function<void(const std::string&, const std::optional<std::vector<std::string>>&)>&
          block);
  void _onQueue_handleChangeFromOldGroupContainerIds(
      const std::optional<std::vector<std::string>>& oldIds,
      const std::optional<std::vector<std::string>>& newIds, int groupType,
      VSACommandQueue* commandQueue);
  void _onQueue_removeReferenceForGroupIdentifiers(const std::vector<std::string>& ids,
                                                   int groupType, VSACommandQueue* commandQueue);
  void _onQueue_removeGroupContainersIfNeededforUserIdentity(const VSAUserIdentityRef& user,
                                                             VSAContainerClass groupContainerClass,
                                                             const std::vector<std::string>& ids,
                                                             VSAReferenceCounts counts,
                                                             VSACommandQueue* commandQueue);
  void _onQueue_queueSystemContainerDeletion(const std::string& identifier,
                                             VSACommandQueue* commandQueue);
  static std::optional<std::vector<std::string>> systemGroupIds(const std::string& identifier,
                                                                const VSAValue* entitlements,
                                                                bool filterPrefix);
  template <typename F>
  auto sync(F&& f) -> decltype(f());

  std::shared_ptr<VSAUserIdentityCache> userIdentityCache_;
  std::shared_ptr<VSAGlobalConfiguration> configuration_;
  VSAWorkQueue::Ref queue_;
  std::unique_ptr<VSASQLiteDB> codeSigningMappingDB_;
  std::shared_ptr<VSALocks> locks_;
  std::shared_ptr<const VSAStageForDeleteEnvironment> stageEnvironment_;
  // Callers' entitlements found recorded (or just recorded), with the
  // database's change count at that moment: while nothing has been written
  // since, the same entitlements need no second look. On the queue.
  struct RecordedEntitlements {
    uint64_t changeCount;
    VSAValue entitlements;
  };
  std::unordered_map<std::string, RecordedEntitlements> recordedEntitlements_;
};

template <typename F>
auto VSACodeSigningMapping::sync(F&& f) -> decltype(f()) {
  if constexpr (std::is_void_v<decltype(f())>) {
    queue_->sync(f);
  } else {
    std::optional<decltype(f())> result;
    queue_->sync([&] { result.emplace(f()); });
    return std::move(*result);
  }
}
