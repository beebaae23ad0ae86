// Small path and file-name string helpers shared by every layer.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

// True when any '/'-separated component of `path` is exactly "..".
bool containsDotDotPathComponents(std::string_view path);

// A string from raw file-system bytes. Linux file names are byte strings, so
// the bytes are taken as they are (up to the first NUL in the first form).
std::string stringWithFileSystemRepresentation(const char* bytes);
std::string stringWithFileSystemRepresentation(const char* bytes, size_t length);

// Appends the UTF-8 encoding of code point `cp` (at most U+10FFFF).
void VSAAppendUTF8(std::string& out, uint32_t cp);

// Joins two path pieces with exactly one '/' between them.
std::string VSAPathJoin(std::string_view base, std::string_view component);

// The last component of a path, ignoring trailing slashes ("/a/b/" gives "b").
std::string VSALastPathComponent(std::string_view path);
// The same, as a view into `path`.
std::string_view VSALastPathComponentView(std::string_view path);

// The path without its last component ("/a/b/" and "/a/b" give "/a"; "b" gives "").
std::string VSADirectoryName(std::string_view path);

// The longest name a client may give for anything the daemon turns into a
// file name (identifiers, group identifiers, persona strings, keys).
inline constexpr size_t kVSAMaxClientNameLength = 255;

// True when `name` can stand as one file-name component without leaving its
// directory: not empty, not "." or "..", no '/', no NUL, at most 255 bytes.
bool VSAIsSafeFileName(std::string_view name);

// The longest relative path a client may give inside a container.
inline constexpr size_t kVSAMaxClientPathLength = 1024;

// True when `path` can name an item strictly below a directory: relative,
// at most 1024 bytes, every component a safe file name (so no "..", no
// ".", no empty component, no NUL). Links on the way are checked where the
// path is resolved, not here.
bool VSAIsSafeRelativePath(std::string_view path);

// A client-supplied string made fit for a log line: control bytes escaped as
// \xNN and anything past `limit` bytes cut off (with the original length).
std::string VSAClientStringForLog(std::string_view text, size_t limit = 96);
