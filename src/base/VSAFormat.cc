#include "base/VSAFormat.h"

#include <cinttypes>
#include <cstdio>

namespace {

// Builds a printf conversion from the parsed flags/width/precision and a
// length-free conversion letter, then prints one value with it.
template <typename V>
void appendWithSpec(std::string& out, const std::string& flags, const char* length, char conv,
                    V value) {
  std::string spec = "%" + flags + length + conv;
  char buf[128];
  int n = std::snprintf(buf, sizeof buf, spec.c_str(), value);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof buf) {
    out.append(buf, n);
    return;
  }
  std::string big(n + 1, '\0');
  std::snprintf(big.data(), big.size(), spec.c_str(), value);
  big.resize(n);
  out += big;
}

void appendText(std::string& out, const std::string& flags, const std::string& text) {
  // Only width and precision matter for text; apply them by hand so that
  // embedded NULs or huge texts never go through snprintf.
  bool left = flags.find('-') != std::string::npos;
  size_t width = 0, precision = std::string::npos;
  size_t dot = flags.find('.');
  std::string w = flags.substr(0, dot);
  for (char c : w)
    if (c >= '0' && c <= '9') width = width * 10 + (c - '0');
  if (dot != std::string::npos) {
    precision = 0;
    for (size_t k = dot + 1; k < flags.size(); ++k)
      if (flags[k] >= '0' && flags[k] <= '9') precision = precision * 10 + (flags[k] - '0');
  }
  std::string s = precision == std::string::npos ? text : text.substr(0, precision);
  if (width > 1024) width = 1024;
  if (s.size() < width && !left) out.append(width - s.size(), ' ');
  out += s;
  if (s.size() < width && left) out.append(width - s.size(), ' ');
}

std::string numberAsText(const VSAFormatArg& a) {
  switch (a.kind) {
    case VSAFormatArg::Kind::Signed:
      return std::to_string(a.i);
    case VSAFormatArg::Kind::Unsigned:
      return std::to_string(a.u);
    case VSAFormatArg::Kind::Double:
      return std::to_string(a.d);
    case VSAFormatArg::Kind::Pointer: {
      char buf[32];
      std::snprintf(buf, sizeof buf, "%p", a.pointer);
      return buf;
    }
    case VSAFormatArg::Kind::Text:
      return a.text;
  }
  return a.text;
}

}  // namespace

std::string VSAFormatArgs(std::string_view format, const std::vector<VSAFormatArg>& args) {
  std::string out;
  out.reserve(format.size() + 32 * args.size());
  size_t next = 0;
  size_t i = 0;
  while (i < format.size()) {
    char c = format[i];
    if (c != '%') {
      out += c;
      ++i;
      continue;
    }
    ++i;
    if (i < format.size() && format[i] == '%') {
      out += '%';
      ++i;
      continue;
    }
    if (i < format.size() && format[i] == '{') {  // privacy / signpost annotations
      size_t close = format.find('}', i);
      i = close == std::string_view::npos ? format.size() : close + 1;
    }
    std::string flags;
    while (i < format.size() &&
           std::string_view("-+ #0123456789.").find(format[i]) != std::string_view::npos) {
      flags += format[i++];
    }
    while (i < format.size() &&
           std::string_view("hlqLjzt").find(format[i]) != std::string_view::npos) {
      ++i;
    }
    if (i >= format.size()) break;
    char conv = format[i++];
    if (next >= args.size()) {
      out += "(missing)";
      continue;
    }
    const VSAFormatArg& a = args[next++];
    switch (conv) {
      case 'd':
      case 'i':
        if (a.kind == VSAFormatArg::Kind::Signed || a.kind == VSAFormatArg::Kind::Unsigned)
          appendWithSpec(out, flags, "ll", 'd', static_cast<long long>(a.i));
        else
          appendText(out, flags, numberAsText(a));
        break;
      case 'u':
      case 'x':
      case 'X':
      case 'o':
        if (a.kind == VSAFormatArg::Kind::Signed || a.kind == VSAFormatArg::Kind::Unsigned)
          appendWithSpec(out, flags, "ll", conv, static_cast<unsigned long long>(a.u));
        else
          appendText(out, flags, numberAsText(a));
        break;
      case 'f':
      case 'F':
      case 'g':
      case 'G':
      case 'e':
      case 'E':
        if (a.kind == VSAFormatArg::Kind::Double)
          appendWithSpec(out, flags, "", conv, a.d);
        else if (a.kind == VSAFormatArg::Kind::Signed)
          appendWithSpec(out, flags, "", conv, static_cast<double>(a.i));
        else if (a.kind == VSAFormatArg::Kind::Unsigned)
          appendWithSpec(out, flags, "", conv, static_cast<double>(a.u));
        else
          appendText(out, flags, a.text);
        break;
      case 'c':
        out += static_cast<char>(a.kind == VSAFormatArg::Kind::Text ? '?' : a.i);
        break;
      case 'p': {
        char buf[32];
        std::snprintf(buf, sizeof buf, "%p", a.pointer);
        out += buf;
        break;
      }
      default:  // 's', '@' and anything unknown print the argument's text
        appendText(out, flags, numberAsText(a));
        break;
    }
  }
  return out;
}
