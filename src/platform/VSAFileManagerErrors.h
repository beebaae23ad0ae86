// Error helpers shared by the VSAFileManager implementation files.
#pragma once

#include "base/VSAError.h"
#include "base/VSALog.h"

// Logs the formatted message under `function` and returns it as a
// POSIX-domain error for `err`.
template <typename... A>
VSAErrorRef VSAFileManagerFail(int err, const char* function, const char* format,
                               const A&... args) {
  std::string message = VSAFormat(format, args...);
  VSALogIn(VSALogCategory::FS, kVSALogError, function, "%s", message);
  return VSAError::posix(err, function, __LINE__, message);
}
