// The persisted form of one pending protection change: the update file's
// keys, its writer and its validating reader. The writer goes through the
// file manager's file system (temporary file, protection class, rename), so
// a reader never sees half a file and tests can fail any step. The reader
// takes only what the writer makes: a binary property list of at most
// kVSADataProtectionUpdateFileMaxSize bytes, read without blocking and
// without following a link. Stateless.
#pragma once

#include <cstdint>
#include <string>

#include "base/VSAError.h"
#include "base/VSAUUID.h"
#include "model/VSAContainerClass.h"
#include "model/VSAUserIdentity.h"
#include "model/VSAUserIdentityCache.h"
#include "platform/VSAFileManager.h"

inline constexpr const char* kVSADataOperationIdentifierKey = "VSADataOperationIdentifier";
inline constexpr const char* kVSADataOperationContainerClassKey = "VSADataOperationContainerClass";
inline constexpr const char* kVSADataOperationProtectionClassKey =
    "VSADataOperationProtectionClass";
inline constexpr const char* kVSADataOperationChangeTypeKey = "VSADataOperationChangeType";
inline constexpr const char* kVSADataOperationRetryIfLockedKey = "VSADataOperationRetryIfLocked";
inline constexpr const char* kVSADataOperationInternalIDKey = "VSADataOperationInternalID";
inline constexpr const char* kVSADataOperationUserIdentityKey = "VSADataOperationUserIdentity";
inline constexpr const char* kVSADataOperationUserIdKey = "VSADataOperationUserId";

// The largest update file read: the writer's dictionary (seven scalars and
// a user identity) takes well under a kilobyte.
inline constexpr size_t kVSADataProtectionUpdateFileMaxSize = 16u << 10;

struct VSADataProtectionUpdate {
  std::string identifier;
  VSAContainerClass containerClass = VSAClass::kUndefined;
  int32_t protectionClass = 0;
  uint32_t changeType = 0;
  bool retryIfLocked = false;
  VSAUUID internalID;
  VSAUserIdentityRef userIdentity;

  // The file's dictionary (the user identity only for classes that need one).
  VSAValue plist() const;
  // Reads and validates an update file; every failure is logged and gives
  // code 29 (a missing or unreadable file, a wrong or missing key, a user
  // identity that cannot be rebuilt).
  static std::optional<VSADataProtectionUpdate> _readAndValidateDataProtectionUpdateAtURL(
      const std::string& url, VSAUserIdentityCache& userIdentityCache, VSAErrorRef* error);
};

// Writes `update` to `url` atomically with protection class `protectionClass`.
bool VSAWriteDataProtectionUpdate(const VSADataProtectionUpdate& update, const std::string& url,
                                  VSAFileManager& fileManager, int protectionClass, mode_t mode,
                                  VSAErrorRef* error);
