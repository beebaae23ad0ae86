// The replace file: the journal of one replace operation in progress. It
// names the four directories the operation moves between, so that the next
// start can put the old container back after a crash between the two
// renames. One binary property list per operation in the replace directory
// (root-only), named "<UUID>.plist", written atomically and durably before
// the first rename and moved to death row when the operation ends.
//
// Reading validates everything (code 35 for any bad form): a file that
// cannot be read or parsed as a binary list, one that is not a dictionary, a value that is
// missing or not a string, and a path that is not absolute, is empty, holds
// a NUL or a ".." component. Reads at most kVSAReplaceFileMaxSize bytes.
// Stateless; thread-safe.
#pragma once

#include <optional>
#include <string>

#include "base/VSAError.h"
#include "platform/VSAFileManager.h"

inline constexpr const char* kVSAReplaceOperationOldURL = "VSAReplaceOperationOldURL";
inline constexpr const char* kVSAReplaceOperationNewURL = "VSAReplaceOperationNewURL";
inline constexpr const char* kVSAReplaceOperationStagingURL = "VSAReplaceOperationStagingURL";
inline constexpr const char* kVSAReplaceOperationDestURL = "VSAReplaceOperationDestURL";

// Four absolute paths take well under a kilobyte each.
inline constexpr size_t kVSAReplaceFileMaxSize = 16u << 10;

struct VSAReplaceFileInfo {
  std::string oldURL;      // the old container's live directory
  std::string newURL;      // the new container's directory before the operation
  std::string stagingURL;  // where the old container waits during the operation
  std::string destURL;     // where the new container ends up
};

class VSAReplaceFile {
 public:
  // 33 when one of the four is missing, 34 when the file cannot be written.
  [[nodiscard]] static bool _writeToDiskReplaceAt(
      VSAFileManager& fileManager, const std::string& url, const std::optional<std::string>& old,
      const std::optional<std::string>& withNew, const std::optional<std::string>& usingStaging,
      const std::optional<std::string>& toDestination, VSAErrorRef* error);
  [[nodiscard]] static std::optional<VSAReplaceFileInfo> _readAndValidateReplaceFileAtUrl(
      VSAFileManager& fileManager, const std::string& url, VSAErrorRef* error);
};
