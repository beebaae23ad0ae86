#include "base/VSAError.h"

#include <cstring>

VSAError::VSAError(std::string domain, int64_t code, std::string message, std::string functionName,
                   uint64_t line, VSAErrorRef underlying)
    : domain_(std::move(domain)),
      code_(code),
      message_(std::move(message)),
      functionName_(std::move(functionName)),
      line_(line),
      underlying_(std::move(underlying)) {}

VSAErrorRef VSAError::posix(int err, const char* function, uint64_t line, std::string message) {
  if (message.empty()) message = std::strerror(err);
  return std::make_shared<const VSAError>(kVSAPOSIXErrorDomain, err, std::move(message), function,
                                          line, nullptr);
}

VSAErrorRef VSAError::inDomain(const char* domain, int64_t code, const char* function,
                               uint64_t line, std::string message) {
  return std::make_shared<const VSAError>(domain, code, std::move(message), function, line,
                                          nullptr);
}

VSAResultCode VSAError::resultCode(VSAResultCode fallback) const {
  if (domain_ == kVSAErrorDomain && code_ > 0) return static_cast<VSAResultCode>(code_);
  return fallback;
}

std::string VSAError::localizedDescription() const {
  if (domain_ != kVSAErrorDomain) return message_;
  if (underlying_) return VSAFormat("%d: %@ (%@)", code_, message_, underlying_->description());
  return VSAFormat("%d: %@", code_, message_);
}

std::string VSAError::description() const {
  return VSAFormat("Error Domain=%s Code=%lld \"%s\" {FunctionName=%s, SourceFileLine=%llu}",
                   domain_, code_, localizedDescription(), functionName_, line_);
}
