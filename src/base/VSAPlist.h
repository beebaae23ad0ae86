// Property-list conversion of VSAValue and the property-list file helpers.
//
// Binary lists go through VSABinaryPlist (our own hardened codec, which keeps
// integer signedness); XML lists go through libplist. Reading detects the
// format. Files are written atomically: a temporary file in the target's
// directory, fsync, rename; a reader never sees a half-written file.
// Stateless and thread-safe.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/VSABinaryPlist.h"
#include "base/VSAError.h"
#include "base/VSAValue.h"

// Write option asking that the written file get no data protection.
inline constexpr uint64_t kVSAWriteFileProtectionNone = 0x10000000;
// Write option for files that need not survive a power loss (run-time state
// below run/): still atomic, but not flushed to the disk.
inline constexpr uint64_t kVSAWriteFileWithoutSync = 0x20000000;
// The general domain's "not a property list of the expected kind" code.
inline constexpr int64_t kVSAPropertyListReadCorruptError = 3840;
inline constexpr int64_t kVSAFileReadCorruptFileError = 2048;

class VSAPlist {
 public:
  enum class Format { Binary, XML };

  static std::optional<std::vector<uint8_t>> serialize(
      const VSAValue& value, Format format, VSAErrorRef* error,
      VSABinaryPlist::UUIDForm uuidForm = VSABinaryPlist::UUIDForm::String);
  // Parses a binary or XML property list.
  static std::optional<VSAValue> parse(const uint8_t* bytes, size_t length, VSAErrorRef* error);
  static std::optional<VSAValue> parse(const std::vector<uint8_t>& bytes, VSAErrorRef* error) {
    return parse(bytes.data(), bytes.size(), error);
  }
};

// Serialises `dictionary` as a binary property list and writes it to `path`
// atomically. `options` carries write options such as
// kVSAWriteFileProtectionNone. Returns false with the serialisation or write
// error.
bool VSA_writeToURL(const VSAValue& dictionary, const std::string& path, uint64_t options,
                    VSAErrorRef* error);
// Reads `path` uncached and parses it; a root that is not a dictionary fails
// with general-domain code 2048.
std::optional<VSAValue> VSA_dictionaryWithContentsOfURL(const std::string& path, uint64_t options,
                                                        VSAErrorRef* error);

// Writes `bytes` to `path` atomically (temporary file + fsync + rename).
bool VSAWriteFileAtomically(const std::string& path, const std::vector<uint8_t>& bytes, mode_t mode,
                            VSAErrorRef* error, bool sync = true);
// mkdir -p: creates `path` and its missing parents (parents 0755, `path`
// itself `mode`); 0 or the errno of the step that failed.
int VSAMakeDirectories(const std::string& path, mode_t mode = 0755);
// Reads a whole file; refuses files larger than `limit` bytes.
std::optional<std::vector<uint8_t>> VSAReadFile(const std::string& path, VSAErrorRef* error,
                                                size_t limit = 64u << 20);
