#include "base/VSAPathString.h"

#include <cstring>

bool containsDotDotPathComponents(std::string_view path) {
  size_t start = 0;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    if (path.substr(start, end - start) == "..") return true;
    start = end + 1;
  }
  return false;
}

std::string stringWithFileSystemRepresentation(const char* bytes) {
  return bytes ? std::string(bytes) : std::string();
}

std::string stringWithFileSystemRepresentation(const char* bytes, size_t length) {
  if (!bytes) return {};
  return std::string(bytes, strnlen(bytes, length));
}

std::string VSAPathJoin(std::string_view base, std::string_view component) {
  while (!component.empty() && component.front() == '/') component.remove_prefix(1);
  const bool slash = base.empty() || base.back() != '/';
  // One allocation of the final size: joins run once per container when a
  // class directory is read.
  std::string out;
  out.reserve(base.size() + (slash ? 1 : 0) + component.size());
  out.append(base);
  if (slash) out += '/';
  out.append(component);
  return out;
}

void VSAAppendUTF8(std::string& out, uint32_t cp) {
  if (cp < 0x80) {
    out += static_cast<char>(cp);
  } else if (cp < 0x800) {
    out += static_cast<char>(0xC0 | (cp >> 6));
    out += static_cast<char>(0x80 | (cp & 0x3F));
  } else if (cp < 0x10000) {
    out += static_cast<char>(0xE0 | (cp >> 12));
    out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (cp & 0x3F));
  } else {
    out += static_cast<char>(0xF0 | (cp >> 18));
    out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
    out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (cp & 0x3F));
  }
}

std::string VSADirectoryName(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return {};
  if (slash == 0) return "/";
  return std::string(path.substr(0, slash));
}

std::string_view VSALastPathComponentView(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  size_t slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::string VSALastPathComponent(std::string_view path) {
  return std::string(VSALastPathComponentView(path));
}

bool VSAIsSafeFileName(std::string_view name) {
  if (name.empty() || name.size() > kVSAMaxClientNameLength || name == "." || name == "..")
    return false;
  return name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
}

bool VSAIsSafeRelativePath(std::string_view path) {
  if (path.empty() || path.size() > kVSAMaxClientPathLength || path.front() == '/') return false;
  size_t start = 0;
  while (true) {
    size_t slash = path.find('/', start);
    std::string_view part = path.substr(
        start, slash == std::string_view::npos ? std::string_view::npos : slash - start);
    if (!VSAIsSafeFileName(part)) return false;
    if (slash == std::string_view::npos) return true;
    start = slash + 1;
  }
}

std::string VSAClientStringForLog(std::string_view text, size_t limit) {
  static const char* hex = "0123456789abcdef";
  std::string out;
  for (size_t i = 0; i < text.size() && i < limit; ++i) {
    auto c = static_cast<unsigned char>(text[i]);
    if (c < 0x20 || c == 0x7f || c == '\\') {
      out += "\\x";
      out += hex[c >> 4];
      out += hex[c & 15];
    } else {
      out += static_cast<char>(c);
    }
  }
  if (text.size() > limit) out += "...(" + std::to_string(text.size()) + " bytes)";
  return out;
}
