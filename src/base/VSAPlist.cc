#include "base/VSAPlist.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <plist/plist.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <limits>
#include <new>
#include <stdexcept>
#include <string_view>

#include "base/VSAPathString.h"

namespace {

// ---- libplist <-> VSAValue (XML only) -------------------------------------

plist_t toPlistNode(const VSAValue& v) {
  switch (v.type()) {
    case VSAValue::Type::Null:
      return plist_new_string("");
    case VSAValue::Type::Bool:
      return plist_new_bool(*v.boolValue());
    case VSAValue::Type::Int:
      return plist_new_uint(static_cast<uint64_t>(*v.int64Value()));
    case VSAValue::Type::UInt:
      return plist_new_uint(*v.uint64Value());
    case VSAValue::Type::Real:
      return plist_new_real(*v.doubleValue());
    case VSAValue::Type::String:
      return plist_new_string(v.stringValue()->c_str());
    case VSAValue::Type::Data:
      return plist_new_data(reinterpret_cast<const char*>(v.dataValue()->data()),
                            v.dataValue()->size());
    case VSAValue::Type::Date: {
      // libplist counts dates from the same 2001 reference date.
      double s = v.dateValue()->secondsSinceReferenceDate;
      double whole =
          s < 0 ? -static_cast<double>(static_cast<int64_t>(-s)) : static_cast<int64_t>(s);
      return plist_new_date(static_cast<int32_t>(whole), static_cast<int32_t>((s - whole) * 1e6));
    }
    case VSAValue::Type::UUID:
      return plist_new_string(v.uuidValue()->string().c_str());
    case VSAValue::Type::Array: {
      plist_t a = plist_new_array();
      for (const VSAValue& c : *v.arrayValue()) plist_array_append_item(a, toPlistNode(c));
      return a;
    }
    case VSAValue::Type::Dictionary: {
      plist_t d = plist_new_dict();
      for (const auto& [k, c] : *v.dictionaryValue())
        plist_dict_set_item(d, k.c_str(), toPlistNode(c));
      return d;
    }
  }
  return plist_new_string("");
}

// Converts libplist's tree, charging each value as the binary decoder does
// (VSABinaryPlist::decodedSize) against `budget`.
struct Budget {
  size_t left;
  bool exceeded = false;
  bool charge(size_t bytes) {
    if (bytes > left) {
      exceeded = true;
      return false;
    }
    left -= bytes;
    return true;
  }
};

bool fromPlistNode(plist_t node, int depth, Budget& budget, VSAValue& out) {
  if (!node || depth > VSABinaryPlist::kMaxDepth) return false;
  if (!budget.charge(VSABinaryPlist::kValueCost)) return false;
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      out = VSAValue(b != 0);
      return true;
    }
    case PLIST_UINT: {
      // XML integers arrive as 64-bit patterns; a pattern with the top bit
      // set was written as a negative number.
      uint64_t u = 0;
      plist_get_uint_val(node, &u);
      out = (u >> 63) ? VSAValue(static_cast<int64_t>(u)) : VSAValue(u);
      return true;
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      out = VSAValue(d);
      return true;
    }
    case PLIST_STRING:
    case PLIST_KEY: {
      char* s = nullptr;
      plist_get_string_val(node, &s);
      bool ok = budget.charge(s ? std::strlen(s) : 0);
      if (ok) out = VSAValue(std::string(s ? s : ""));
      free(s);
      return ok;
    }
    case PLIST_DATA: {
      char* p = nullptr;
      uint64_t n = 0;
      plist_get_data_val(node, &p, &n);
      bool ok = budget.charge(n);
      if (ok)
        out = VSAValue(
            VSAValue::Data(reinterpret_cast<uint8_t*>(p), reinterpret_cast<uint8_t*>(p) + n));
      free(p);
      return ok;
    }
    case PLIST_DATE: {
      int32_t sec = 0, usec = 0;
      plist_get_date_val(node, &sec, &usec);
      out = VSAValue(VSADate{sec + usec / 1e6});
      return true;
    }
    case PLIST_ARRAY: {
      VSAValue::Array a;
      uint32_t n = plist_array_get_size(node);
      for (uint32_t i = 0; i < n; ++i) {
        VSAValue c;
        if (!fromPlistNode(plist_array_get_item(node, i), depth + 1, budget, c)) return false;
        a.push_back(std::move(c));
      }
      out = VSAValue(std::move(a));
      return true;
    }
    case PLIST_DICT: {
      VSAValue::Dictionary d;
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      bool ok = true;
      while (ok) {
        char* key = nullptr;
        plist_t val = nullptr;
        plist_dict_next_item(node, it, &key, &val);
        if (!val) {
          free(key);
          break;
        }
        VSAValue c;
        ok = key && budget.charge(VSABinaryPlist::kValueCost + std::strlen(key)) &&
             fromPlistNode(val, depth + 1, budget, c);
        if (ok) d[key] = std::move(c);
        free(key);
      }
      // The iterator is freed even when a key was refused.
      free(it);
      if (!ok) return false;
      out = VSAValue(std::move(d));
      return true;
    }
    default:
      return false;
  }
}

VSAErrorRef parseError(const std::string& why) {
  return VSAError::inDomain(kVSACocoaErrorDomain, kVSAPropertyListReadCorruptError, __func__,
                            __LINE__,
                            "The data couldn't be read because it isn't in the correct "
                            "format (" +
                                why + ").");
}

}  // namespace

std::optional<std::vector<uint8_t>> VSAPlist::serialize(const VSAValue& value, Format format,
                                                        VSAErrorRef* error,
                                                        VSABinaryPlist::UUIDForm uuidForm) {
  if (format == Format::Binary) {
    std::string why;
    auto bytes = VSABinaryPlist::encode(value, uuidForm, &why);
    if (!bytes) VSASetError(error, parseError(why));
    return bytes;
  }
  plist_t node = toPlistNode(value);
  char* xml = nullptr;
  uint32_t n = 0;
  plist_to_xml(node, &xml, &n);
  plist_free(node);
  if (!xml) {
    VSASetError(error, parseError("XML serialisation failed"));
    return std::nullopt;
  }
  std::vector<uint8_t> out(xml, xml + n);
  plist_to_xml_free(xml);
  return out;
}

namespace {

bool startsWith(const uint8_t* p, const uint8_t* end, const char* text) {
  size_t n = std::strlen(text);
  return static_cast<size_t>(end - p) >= n && std::memcmp(p, text, n) == 0;
}

// The position just past the first `text` at or after `p`, or `end`.
const uint8_t* skipPast(const uint8_t* p, const uint8_t* end, const char* text) {
  size_t n = std::strlen(text);
  const uint8_t* hit = std::search(p, end, text, text + n);
  return hit == end ? end : hit + n;
}

bool isTagEnd(uint8_t c) {
  return c == ' ' || c == '\t' || c == '\r' || c == '\n' || c == '<' || c == '>';
}

std::optional<VSAValue> parseXML(const uint8_t* bytes, size_t length, std::string* why) {
  if (length == 0) {
    *why = "empty";
    return std::nullopt;
  }
  if (length > kVSAMaxXMLPropertyListSize) {
    *why = "XML property list too large";
    return std::nullopt;
  }
  // NUL is no XML character, and libplist asserts (ending the process) on a
  // string or key that holds one.
  if (std::memchr(bytes, 0, length)) {
    *why = "NUL byte in XML text";
    return std::nullopt;
  }
  // libplist builds and frees its tree recursively: a deep list must be
  // refused before it gets there. The root sits at depth 0, so kMaxDepth + 1
  // collections may nest; the conversion below checks every value's depth.
  if (VSAPlist::xmlNestingDepth(bytes, length) >
      static_cast<size_t>(VSABinaryPlist::kMaxDepth) + 1) {
    *why = "nesting too deep";
    return std::nullopt;
  }
  plist_t node = nullptr;
  plist_from_xml(reinterpret_cast<const char*>(bytes), static_cast<uint32_t>(length), &node);
  if (!node) {
    *why = "not a property list";
    return std::nullopt;
  }
  VSAValue out;
  Budget budget{VSABinaryPlist::decodedSizeBudget(length)};
  bool ok = false;
  try {
    ok = fromPlistNode(node, 0, budget, out);
    if (!ok) *why = budget.exceeded ? "decoded size exceeds the budget" : "not a property list";
  } catch (const std::bad_alloc&) {
    *why = "out of memory while decoding";
  } catch (const std::length_error&) {
    *why = "out of memory while decoding";
  }
  plist_free(node);
  if (!ok) return std::nullopt;
  return out;
}

}  // namespace

size_t VSAPlist::xmlNestingDepth(const uint8_t* bytes, size_t length) {
  const uint8_t* p = bytes;
  const uint8_t* end = bytes + length;
  size_t depth = 0, deepest = 0;
  while ((p = std::find(p, end, '<')) != end) {
    if (startsWith(p, end, "<!--")) {
      p = skipPast(p + 4, end, "-->");
    } else if (startsWith(p, end, "<![CDATA[")) {
      p = skipPast(p + 9, end, "]]>");
    } else if (startsWith(p, end, "<?")) {
      p = skipPast(p + 2, end, "?>");
    } else if (startsWith(p, end, "<!DOCTYPE")) {
      // An internal subset runs to "]>", otherwise the declaration ends at '>'.
      const uint8_t* q = p + 9;
      while (q != end && *q != '[' && *q != '>') ++q;
      p = q != end && *q == '[' ? skipPast(q, end, "]>") : (q == end ? end : q + 1);
    } else {
      const uint8_t* name = p + 1;
      const uint8_t* q = name;
      while (q != end && !isTagEnd(*q)) ++q;
      std::string_view tag(reinterpret_cast<const char*>(name), q - name);
      // The tag ends at the next '>' (a '<' first is an error to libplist).
      // Looking no further than the next '<' keeps the scan linear.
      const uint8_t* close = q;
      while (close != end && *close != '>' && *close != '<') ++close;
      bool empty = close != end && *close == '>' && close > name && close[-1] == '/';
      if (tag == "/array" || tag == "/dict") {
        if (depth > 0) --depth;
      } else if (!empty && (tag.starts_with("array") || tag.starts_with("dict"))) {
        deepest = std::max(deepest, ++depth);
      }
      p = q;
    }
  }
  return deepest;
}

std::optional<VSAValue> VSAPlist::parse(const uint8_t* bytes, size_t length, VSAErrorRef* error,
                                        Accept accept) {
  std::string why;
  std::optional<VSAValue> value;
  if (VSABinaryPlist::isBinaryPlist(bytes, length)) {
    value = VSABinaryPlist::decode(bytes, length, &why);
  } else if (accept == Accept::BinaryOnly) {
    why = "not a binary property list";
  } else {
    value = parseXML(bytes, length, &why);
  }
  if (!value) VSASetError(error, parseError(why));
  return value;
}

namespace {
// The directory that holds `path`, opened without following a link anywhere
// on the way: the file is then made, renamed and synced through it.
int openParentDirectory(const std::string& path) {
  std::string dir = VSADirectoryName(path);
  if (dir.empty()) dir = ".";
  struct open_how how {};
  how.flags = O_RDONLY | O_DIRECTORY | O_CLOEXEC;
  how.resolve = RESOLVE_NO_SYMLINKS;
  int fd = static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, dir.c_str(), &how, sizeof how));
  if (fd < 0 && errno == ENOSYS) fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  return fd;
}

// A new file "<name>.tmp-XXXXXXXX" in `dir`, created exclusively; -1 with errno.
int createTemporary(int dir, const std::string& name, std::string* tmp) {
  for (int attempt = 0; attempt < 100; ++attempt) {
    uint32_t r = 0;
    if (::getrandom(&r, sizeof r, 0) != sizeof r) return -1;
    char suffix[16];
    std::snprintf(suffix, sizeof suffix, ".tmp-%08x", r);
    *tmp = name + suffix;
    int fd =
        ::openat(dir, tmp->c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd >= 0 || errno != EEXIST) return fd;
  }
  errno = EEXIST;
  return -1;
}

// Puts `tmp` in the place of the regular file `name` (both in `dir`) without
// making the kernel write `tmp`'s data out now. Replacing a file by rename
// does (ext4 allocates and flushes the new file's blocks, and the next
// journal commit, which any fsync of the daemon's requests waits for, waits
// for them too): a guard for files that must outlive a power loss. Run-time
// state need not, so the two names are swapped and the old file, now at
// `tmp`, is dropped; the data is left to ordinary writeback, which a file
// replaced again within seconds never reaches. Anything but a regular file
// at `name` (or nothing) gets the plain rename and its answer.
int replaceWithoutFlush(int dir, const std::string& tmp, const std::string& name) {
  struct stat st;
  if (::fstatat(dir, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(st.st_mode)) {
    if (::renameat2(dir, tmp.c_str(), dir, name.c_str(), RENAME_EXCHANGE) == 0) {
      ::unlinkat(dir, tmp.c_str(), 0);
      return 0;
    }
    if (errno != EINVAL && errno != ENOSYS && errno != ENOENT) return errno;
  }
  return ::renameat(dir, tmp.c_str(), dir, name.c_str()) == 0 ? 0 : errno;
}

int writeAll(int fd, const std::vector<uint8_t>& bytes) {
  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t w = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (w < 0 && errno == EINTR) continue;
    if (w < 0) return errno;
    done += static_cast<size_t>(w);
  }
  return 0;
}
}  // namespace

bool VSAWriteFileAtomically(const std::string& path, const std::vector<uint8_t>& bytes, mode_t mode,
                            VSAErrorRef* error, bool sync) {
  std::string name = VSALastPathComponent(path), tmp;
  int dir = openParentDirectory(path);
  int fd = dir < 0 ? -1 : createTemporary(dir, name, &tmp);
  if (fd < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    if (dir >= 0) ::close(dir);
    return false;
  }
  int err = writeAll(fd, bytes);
  if (!err && fchmod(fd, mode) != 0) err = errno;
  if (!err && sync && fsync(fd) != 0) err = errno;
  if (::close(fd) != 0 && !err) err = errno;
  if (!err)
    err = sync ? (::renameat(dir, tmp.c_str(), dir, name.c_str()) == 0 ? 0 : errno)
               : replaceWithoutFlush(dir, tmp, name);
  if (err) {
    ::unlinkat(dir, tmp.c_str(), 0);
    VSASetError(error, VSA_POSIX_ERROR(err));
  } else if (sync) {
    ::fsync(dir);  // the rename is the commit; it is durable once the directory is synced
  }
  ::close(dir);
  return err == 0;
}

int VSAMakeDirectories(const std::string& path, mode_t mode) {
  for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
    if (::mkdir(path.substr(0, pos).c_str(), 0755) != 0 && errno != EEXIST) return errno;
  }
  if (::mkdir(path.c_str(), mode) != 0 && errno != EEXIST) return errno;
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return errno;
  return S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
}

int VSAReadRegularFile(const std::string& path, size_t limit, std::vector<uint8_t>* bytes,
                       struct stat* status) {
  return VSAReadRegularFileAt(AT_FDCWD, path, limit, bytes, status);
}

int VSAReadRegularFileAt(int dir, const std::string& path, size_t limit,
                         std::vector<uint8_t>* bytes, struct stat* status) {
  bytes->clear();
  // O_NONBLOCK: opening a FIFO for reading would otherwise wait for a writer
  // for ever. It changes nothing for the regular files read below.
  // No link anywhere in the path: a directory that a user owns and swapped
  // for a link must not make the daemon read from elsewhere.
  struct open_how how {};
  how.flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  how.resolve = RESOLVE_NO_SYMLINKS | (dir == AT_FDCWD ? 0 : RESOLVE_BENEATH);
  int fd = static_cast<int>(::syscall(SYS_openat2, dir, path.c_str(), &how, sizeof how));
  if (fd < 0 && errno == ENOSYS) {
    // Without openat2, "beneath" is kept by refusing what could leave `dir`:
    // an absolute path or a ".." component.
    if (dir != AT_FDCWD && (path.starts_with('/') || path == ".." || path.starts_with("../") ||
                            path.ends_with("/..") || path.find("/../") != std::string::npos))
      return EXDEV;
    fd = ::openat(dir, path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
  }
  if (fd < 0) return errno;
  struct stat st;
  int rc = 0;
  if (fstat(fd, &st) != 0)
    rc = errno;
  else if (!S_ISREG(st.st_mode))
    rc = EINVAL;
  else if (st.st_size < 0 || static_cast<uint64_t>(st.st_size) > limit)
    rc = EFBIG;  // refused by its size: a huge (or sparse) file is never read
  if (rc == 0) {
    // The file may grow after fstat: read at most one byte past the limit,
    // into a buffer sized by what was there when it was checked.
    bytes->reserve(static_cast<size_t>(st.st_size));
    uint8_t buf[65536];
    for (;;) {
      size_t room = limit - bytes->size();  // never negative: reads stop past the limit
      size_t want = room >= sizeof buf ? sizeof buf : room + 1;
      ssize_t n = ::read(fd, buf, want);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) rc = errno;
      if (n <= 0) break;
      if (bytes->size() + static_cast<size_t>(n) > limit) {
        rc = EFBIG;
        break;
      }
      bytes->insert(bytes->end(), buf, buf + n);
    }
  }
  ::close(fd);
  if (rc != 0) {
    bytes->clear();
    bytes->shrink_to_fit();
  } else if (status) {
    *status = st;
  }
  return rc;
}

std::optional<std::vector<uint8_t>> VSAReadFile(const std::string& path, VSAErrorRef* error,
                                                size_t limit) {
  std::vector<uint8_t> bytes;
  if (int rc = VSAReadRegularFile(path, limit, &bytes)) {
    VSASetError(error, VSA_POSIX_ERROR(rc));
    return std::nullopt;
  }
  return bytes;
}

bool VSA_writeToURL(const VSAValue& dictionary, const std::string& path, uint64_t options,
                    VSAErrorRef* error) {
  // Protection is applied by the file manager where the caller asks for it.
  auto bytes = VSAPlist::serialize(dictionary, VSAPlist::Format::Binary, error);
  if (!bytes) return false;
  return VSAWriteFileAtomically(path, *bytes, 0644, error, !(options & kVSAWriteFileWithoutSync));
}

std::optional<VSAValue> VSA_dictionaryWithContentsOfURL(const std::string& path, uint64_t options,
                                                        VSAErrorRef* error, size_t limit) {
  auto bytes = VSAReadFile(path, error, limit);
  if (!bytes) return std::nullopt;
  auto value =
      VSAPlist::parse(*bytes, error,
                      (options & kVSAReadBinaryPropertyListOnly) ? VSAPlist::Accept::BinaryOnly
                                                                 : VSAPlist::Accept::AnyFormat);
  if (!value) return std::nullopt;
  if (!value->isDictionary()) {
    VSASetError(error,
                VSAError::inDomain(kVSACocoaErrorDomain, kVSAFileReadCorruptFileError, __func__,
                                   __LINE__, "The file isn't in the correct format."));
    return std::nullopt;
  }
  return value;
}
