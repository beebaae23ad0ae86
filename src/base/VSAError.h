// Result codes and error objects.
//
// A result code is a 64-bit unsigned number, 1 meaning success; it is what
// is compared, replied ("ReplyError") and persisted. Where a richer report is
// wanted the code is wrapped in a VSAError: domain, code, message, the raising
// routine's name and source line, and an optional underlying error. Errors are
// immutable and shared through VSAErrorRef; operations hand them up through a
// `VSAErrorRef*` out-parameter that may be null. Thread-safe (immutable).
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "base/VSAFormat.h"

using VSAResultCode = uint64_t;

// Every result code: its name here, its number on the wire (part of the
// client protocol: never renumbered) and what it means, in one list that the
// constants and the table of meanings (vessactl, logs) are both made from.
#define VSA_RESULT_CODES(X)                                                          \
  X(kSuccess, 1, "success")                                                          \
  X(kTransientRemovalFailed, 5, "a transient container could not be removed")        \
  X(kStagingCreateFailed, 7, "the staging directory could not be made")              \
  X(kStagingMoveFailed, 8, "a new container could not be moved into place")          \
  X(kStagingRemovalFailed, 9, "a staging directory could not be removed")            \
  X(kNotAUUID, 10, "not a UUID")                                                     \
  X(kInvalidArgument, 11, "invalid argument")                                        \
  X(kMetadataUnreadable, 12, "metadata file unreadable")                             \
  X(kMoveToStagingFailed, 14, "the old container could not be moved to staging")     \
  X(kMoveToDestinationFailed, 15, "the new container could not be moved into place") \
  X(kMissingIdentifier, 18, "no identifier")                                         \
  X(kInvalidClass, 20, "container class out of range")                               \
  X(kContainerNotFound, 21, "container not found")                                   \
  X(kSameContainer, 22, "a container cannot replace itself")                         \
  X(kDifferentClasses, 23, "the containers are of different classes")                \
  X(kInfoValueNotSet, 24, "info value not set")                                      \
  X(kAlreadyExists, 27, "already exists")                                            \
  X(kDeleteFailed, 28, "could not be deleted")                                       \
  X(kInvalidUpdateFile, 29, "invalid update file")                                   \
  X(kInvalidReplaceInfo, 33, "invalid replace information")                          \
  X(kWriteFailed, 34, "a file could not be written")                                 \
  X(kInvalidReplaceFile, 35, "invalid replace file")                                 \
  X(kRemoveFailed, 36, "a file could not be removed")                                \
  X(kOutOfRange, 38, "value out of range")                                           \
  X(kExceptionInTransaction, 40, "an exception ended the operation")                 \
  X(kDeathRowMoveFailed, 41, "could not move to death row")                          \
  X(kCacheRebuildFailed, 43, "a class of containers could not be read")              \
  X(kCacheInconsistent, 44, "a cached container has no metadata file")               \
  X(kCacheAddFailed, 45, "the container could not be cached")                        \
  X(kCacheRemoveFailed, 46, "the container could not be removed from the cache")     \
  X(kCacheEntryWithoutURL, 47, "a cached container has no path")                     \
  X(kMoveToNewUUIDFailed, 48, "could not move the directory to its new UUID name")   \
  X(kInvalidCommand, 49, "invalid or retired command")                               \
  X(kNotEntitled, 55, "client not entitled")                                         \
  X(kDeviceLocked, 61, "device locked")                                              \
  X(kACLFailed, 63, "access control list failed")                                    \
  X(kDatabaseFailed, 66, "code-signing database failure")                            \
  X(kNotFoundInDatabase, 67, "not in the code-signing database")                     \
  X(kUnexpectedChangeCount, 68, "code-signing database changed unexpectedly")        \
  X(kAllocationFailed, 73, "allocation failed")                                      \
  X(kInvalidUserIdentityPlist, 75, "invalid user identity")                          \
  X(kInvalidPersona, 76, "persona not allowed or unknown")                           \
  X(kQueueExhausted, 77, "the command queue gave up")

namespace VSAResult {
#define VSA_RESULT_CONSTANT(name, value, meaning) constexpr VSAResultCode name = value;
VSA_RESULT_CODES(VSA_RESULT_CONSTANT)
#undef VSA_RESULT_CONSTANT

struct Description {
  VSAResultCode code;
  const char* name;
  const char* meaning;
};
// Every code, in increasing order.
inline constexpr Description kAll[] = {
#define VSA_RESULT_DESCRIPTION(name, value, meaning) {value, #name, meaning},
    VSA_RESULT_CODES(VSA_RESULT_DESCRIPTION)
#undef VSA_RESULT_DESCRIPTION
};
// What `code` means; null for a number that is no result code.
inline const char* meaning(VSAResultCode code) {
  for (const Description& d : kAll)
    if (d.code == code) return d.meaning;
  return nullptr;
}
}  // namespace VSAResult

inline constexpr const char* kVSAErrorDomain = "VSAErrorDomain";
inline constexpr const char* kVSAPOSIXErrorDomain = "NSPOSIXErrorDomain";
inline constexpr const char* kVSACocoaErrorDomain = "NSCocoaErrorDomain";

class VSAError;
using VSAErrorRef = std::shared_ptr<const VSAError>;

class VSAError {
 public:
  VSAError(std::string domain, int64_t code, std::string message, std::string functionName,
           uint64_t line, VSAErrorRef underlying);

  // (code, underlying error or none, routine name, line, message format...).
  template <typename... A>
  static VSAErrorRef make(VSAResultCode code, VSAErrorRef underlying, const char* function,
                          uint64_t line, std::string_view format, const A&... args) {
    return std::make_shared<const VSAError>(kVSAErrorDomain, static_cast<int64_t>(code),
                                            VSAFormat(format, args...), function, line,
                                            std::move(underlying));
  }
  // A POSIX-domain error for an errno value.
  static VSAErrorRef posix(int err, const char* function, uint64_t line, std::string message = {});
  // An error of any domain (used for the general domain's property-list codes).
  static VSAErrorRef inDomain(const char* domain, int64_t code, const char* function, uint64_t line,
                              std::string message);

  const std::string& domain() const { return domain_; }
  int64_t code() const { return code_; }
  // The result code carried by this error; a POSIX or general-domain error
  // carries no result code of its own and maps to `fallback`.
  VSAResultCode resultCode(VSAResultCode fallback) const;
  const std::string& message() const { return message_; }
  const std::string& functionName() const { return functionName_; }
  uint64_t sourceFileLine() const { return line_; }
  const VSAErrorRef& underlyingError() const { return underlying_; }

  // "%d: %@ (%@)" with the underlying error's description, else "%d: %@".
  std::string localizedDescription() const;
  // "Error Domain=... Code=... \"<localized description>\"", as logs show it.
  std::string description() const;

 private:
  std::string domain_;
  int64_t code_;
  std::string message_;
  std::string functionName_;
  uint64_t line_;
  VSAErrorRef underlying_;
};

// Builds a VSAErrorDomain error at the call site.
#define VSA_ERROR(code, ...) VSAError::make((code), nullptr, __func__, __LINE__, __VA_ARGS__)
#define VSA_ERROR_UNDERLYING(code, underlying, ...) \
  VSAError::make((code), (underlying), __func__, __LINE__, __VA_ARGS__)
#define VSA_POSIX_ERROR(err, ...) VSAError::posix((err), __func__, __LINE__, ##__VA_ARGS__)

// Stores `error` through an optional out-parameter.
inline void VSASetError(VSAErrorRef* out, VSAErrorRef error) {
  if (out) *out = std::move(error);
}
// Stores `code` through an optional result-code cell.
inline void VSASetCode(VSAResultCode* cell, VSAResultCode code) {
  if (cell) *cell = code;
}
