// Property-list conversion of VSAValue and the property-list file helpers.
//
// Binary lists go through VSABinaryPlist (our own hardened codec, which keeps
// integer signedness); XML lists go through libplist. Reading detects the
// format, unless the caller accepts binary lists only (files the daemon
// itself writes in binary form). Both formats get the same bounds: nesting
// deeper than VSABinaryPlist::kMaxDepth and decoded values costing more than
// VSABinaryPlist::decodedSizeBudget(input length) are refused. XML text is
// refused above kVSAMaxXMLPropertyListSize, and its nesting is counted by a
// scan of the text before libplist (which recurses) sees it. Files are
// written atomically: a temporary file in the target's directory, fsync,
// rename; a reader never sees a half-written file. Stateless and thread-safe.
#pragma once

#include <sys/stat.h>

#include <cstddef>
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
// Read option of VSA_dictionaryWithContentsOfURL: the file is one the daemon
// writes in binary form, so XML text in its place is refused.
inline constexpr uint64_t kVSAReadBinaryPropertyListOnly = 0x40000000;

// Read limits. A file larger than its limit is refused without being read.
// Configuration and run-time state the daemon or root writes:
inline constexpr size_t kVSADefaultReadFileLimit = 64u << 20;
// XML text handed to libplist, whose node tree takes many times the text.
inline constexpr size_t kVSAMaxXMLPropertyListSize = 4u << 20;

class VSAPlist {
 public:
  enum class Format { Binary, XML };
  // Which formats parse() accepts.
  enum class Accept { AnyFormat, BinaryOnly };

  static std::optional<std::vector<uint8_t>> serialize(
      const VSAValue& value, Format format, VSAErrorRef* error,
      VSABinaryPlist::UUIDForm uuidForm = VSABinaryPlist::UUIDForm::String);
  // Parses a binary or XML property list (a binary one only with
  // Accept::BinaryOnly). Fails with code 3840 for anything malformed, too
  // deep, too large once decoded, or when memory runs out.
  static std::optional<VSAValue> parse(const uint8_t* bytes, size_t length, VSAErrorRef* error,
                                       Accept accept = Accept::AnyFormat);
  static std::optional<VSAValue> parse(const std::vector<uint8_t>& bytes, VSAErrorRef* error,
                                       Accept accept = Accept::AnyFormat) {
    return parse(bytes.data(), bytes.size(), error, accept);
  }
  // The deepest nesting of <array> and <dict> elements in XML text, counted
  // the way libplist reads tags (comments, CDATA sections, processing
  // instructions and DOCTYPE skipped). Errs on the high side: any tag whose
  // name starts with "array" or "dict" opens a level.
  static size_t xmlNestingDepth(const uint8_t* bytes, size_t length);
};

// Serialises `dictionary` as a binary property list and writes it to `path`
// atomically. `options` carries write options such as
// kVSAWriteFileProtectionNone. Returns false with the serialisation or write
// error.
bool VSA_writeToURL(const VSAValue& dictionary, const std::string& path, uint64_t options,
                    VSAErrorRef* error);
// Reads `path` uncached (refusing it above `limit` bytes, see VSAReadFile)
// and parses it; a root that is not a dictionary fails with general-domain
// code 2048. `options` may hold kVSAReadBinaryPropertyListOnly.
std::optional<VSAValue> VSA_dictionaryWithContentsOfURL(const std::string& path, uint64_t options,
                                                        VSAErrorRef* error,
                                                        size_t limit = kVSADefaultReadFileLimit);

// Writes `bytes` to `path` atomically and durably (temporary file, fsync,
// rename, fsync of the directory), all through the file's directory opened
// without following a link on the way (ELOOP if there is one). Without `sync`: neither fsync, and
// an existing regular file is replaced by swapping the names, which leaves the new data to ordinary
// writeback instead of flushing it at once.
bool VSAWriteFileAtomically(const std::string& path, const std::vector<uint8_t>& bytes, mode_t mode,
                            VSAErrorRef* error, bool sync = true);
// mkdir -p: creates `path` and its missing parents (parents 0755, `path`
// itself `mode`); 0 or the errno of the step that failed.
int VSAMakeDirectories(const std::string& path, mode_t mode = 0755);
// Reads regular file `path` whole, safe against whatever an app or user put
// in its place: opened O_RDONLY|O_NOFOLLOW|O_NONBLOCK|O_CLOEXEC|O_NOCTTY (a
// FIFO or device cannot block the caller, a final symbolic link is not
// followed), checked with fstat on the open descriptor, and read only up to
// `limit` bytes. Returns 0 or an errno:
//   ELOOP   the final component is a symbolic link,
//   ENXIO   it is a socket (the kernel refuses to open one),
//   EINVAL  it is any other kind of non-regular file (directory, FIFO, device),
//   EFBIG   it holds more than `limit` bytes (refused by its size before any
//           read, or as soon as a read passes the limit if it grew),
//   or the errno of open/fstat/read. `status`, when given, receives the
// fstat of the descriptor that was read.
int VSAReadRegularFile(const std::string& path, size_t limit, std::vector<uint8_t>* bytes,
                       struct stat* status = nullptr);
// The same for `path` relative to the open directory `dir` (or AT_FDCWD):
// with a directory, the path must also resolve beneath it (EXDEV otherwise).
int VSAReadRegularFileAt(int dir, const std::string& path, size_t limit,
                         std::vector<uint8_t>* bytes, struct stat* status = nullptr);
// VSAReadRegularFile with its errno as a POSIX-domain error.
std::optional<std::vector<uint8_t>> VSAReadFile(const std::string& path, VSAErrorRef* error,
                                                size_t limit = kVSADefaultReadFileLimit);
