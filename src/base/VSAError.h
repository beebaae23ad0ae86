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

// Codes whose meaning other parts rely on. The values are part of the client
// protocol and must never be renumbered.
namespace VSAResult {
constexpr VSAResultCode kSuccess = 1;
constexpr VSAResultCode kInvalidArgument = 11;
constexpr VSAResultCode kMetadataUnreadable = 12;
constexpr VSAResultCode kMissingIdentifier = 18;
constexpr VSAResultCode kInvalidClass = 20;
constexpr VSAResultCode kContainerNotFound = 21;
constexpr VSAResultCode kInvalidUpdateFile = 29;
constexpr VSAResultCode kWriteFailed = 34;
constexpr VSAResultCode kInvalidReplaceFile = 35;
constexpr VSAResultCode kRemoveFailed = 36;
constexpr VSAResultCode kOutOfRange = 38;
constexpr VSAResultCode kExceptionInTransaction = 40;
constexpr VSAResultCode kDeathRowMoveFailed = 41;
constexpr VSAResultCode kInvalidCommand = 49;
constexpr VSAResultCode kNotEntitled = 55;
constexpr VSAResultCode kDeviceLocked = 61;
constexpr VSAResultCode kACLFailed = 63;
constexpr VSAResultCode kDatabaseFailed = 66;
constexpr VSAResultCode kNotFoundInDatabase = 67;
constexpr VSAResultCode kUnexpectedChangeCount = 68;
constexpr VSAResultCode kAllocationFailed = 73;
constexpr VSAResultCode kInvalidUserIdentityPlist = 75;
constexpr VSAResultCode kInvalidPersona = 76;
constexpr VSAResultCode kQueueExhausted = 77;
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
