#include "base/VSAPlist.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <limits>

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

bool fromPlistNode(plist_t node, int depth, VSAValue& out) {
  if (!node || depth > VSABinaryPlist::kMaxDepth) return false;
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
      out = VSAValue(std::string(s ? s : ""));
      free(s);
      return true;
    }
    case PLIST_DATA: {
      char* p = nullptr;
      uint64_t n = 0;
      plist_get_data_val(node, &p, &n);
      out = VSAValue(
          VSAValue::Data(reinterpret_cast<uint8_t*>(p), reinterpret_cast<uint8_t*>(p) + n));
      free(p);
      return true;
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
        if (!fromPlistNode(plist_array_get_item(node, i), depth + 1, c)) return false;
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
        ok = key && fromPlistNode(val, depth + 1, c);
        if (ok) d[key] = std::move(c);
        free(key);
      }
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

std::optional<VSAValue> VSAPlist::parse(const uint8_t* bytes, size_t length, VSAErrorRef* error) {
  if (VSABinaryPlist::isBinaryPlist(bytes, length)) {
    std::string why;
    auto v = VSABinaryPlist::decode(bytes, length, &why);
    if (!v) VSASetError(error, parseError(why));
    return v;
  }
  if (length == 0 || length > std::numeric_limits<uint32_t>::max()) {
    VSASetError(error, parseError("empty or oversized"));
    return std::nullopt;
  }
  plist_t node = nullptr;
  plist_from_xml(reinterpret_cast<const char*>(bytes), static_cast<uint32_t>(length), &node);
  VSAValue out;
  bool ok = node && fromPlistNode(node, 0, out);
  if (node) plist_free(node);
  if (!ok) {
    VSASetError(error, parseError("not a property list"));
    return std::nullopt;
  }
  return out;
}

bool VSAWriteFileAtomically(const std::string& path, const std::vector<uint8_t>& bytes, mode_t mode,
                            VSAErrorRef* error, bool sync) {
  std::string tmp = path + ".tmp-XXXXXX";
  int fd = mkstemp(tmp.data());
  if (fd < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    return false;
  }
  size_t done = 0;
  int err = 0;
  while (done < bytes.size()) {
    ssize_t w = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (w < 0) {
      if (errno == EINTR) continue;
      err = errno;
      break;
    }
    done += static_cast<size_t>(w);
  }
  if (!err && fchmod(fd, mode) != 0) err = errno;
  if (!err && sync && fsync(fd) != 0) err = errno;
  if (::close(fd) != 0 && !err) err = errno;
  if (!err && ::rename(tmp.c_str(), path.c_str()) != 0) err = errno;
  if (err) {
    ::unlink(tmp.c_str());
    VSASetError(error, VSA_POSIX_ERROR(err));
    return false;
  }
  return true;
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

std::optional<std::vector<uint8_t>> VSAReadFile(const std::string& path, VSAErrorRef* error,
                                                size_t limit) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) {
    VSASetError(error, VSA_POSIX_ERROR(errno));
    return std::nullopt;
  }
  struct stat st;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) || static_cast<size_t>(st.st_size) > limit) {
    int err = S_ISREG(st.st_mode) ? EFBIG : EINVAL;
    ::close(fd);
    VSASetError(error, VSA_POSIX_ERROR(err));
    return std::nullopt;
  }
  std::vector<uint8_t> out;
  out.reserve(st.st_size);
  uint8_t buf[65536];
  for (;;) {
    ssize_t r = ::read(fd, buf, sizeof buf);
    if (r < 0 && errno == EINTR) continue;
    if (r < 0) {
      int err = errno;
      ::close(fd);
      VSASetError(error, VSA_POSIX_ERROR(err));
      return std::nullopt;
    }
    if (r == 0) break;
    if (out.size() + r > limit) {
      ::close(fd);
      VSASetError(error, VSA_POSIX_ERROR(EFBIG));
      return std::nullopt;
    }
    out.insert(out.end(), buf, buf + r);
  }
  ::close(fd);
  return out;
}

bool VSA_writeToURL(const VSAValue& dictionary, const std::string& path, uint64_t options,
                    VSAErrorRef* error) {
  // Protection is applied by the file manager where the caller asks for it.
  auto bytes = VSAPlist::serialize(dictionary, VSAPlist::Format::Binary, error);
  if (!bytes) return false;
  return VSAWriteFileAtomically(path, *bytes, 0644, error, !(options & kVSAWriteFileWithoutSync));
}

std::optional<VSAValue> VSA_dictionaryWithContentsOfURL(const std::string& path, uint64_t options,
                                                        VSAErrorRef* error) {
  (void)options;
  auto bytes = VSAReadFile(path, error);
  if (!bytes) return std::nullopt;
  auto value = VSAPlist::parse(*bytes, error);
  if (!value) return std::nullopt;
  if (!value->isDictionary()) {
    VSASetError(error,
                VSAError::inDomain(kVSACocoaErrorDomain, kVSAFileReadCorruptFileError, __func__,
                                   __LINE__, "The file isn't in the correct format."));
    return std::nullopt;
  }
  return value;
}
