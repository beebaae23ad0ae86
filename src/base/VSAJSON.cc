#include "base/VSAJSON.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>

#include "base/VSAPathString.h"

namespace {

class Parser {
 public:
  explicit Parser(std::string_view t) : t_(t) {}

  std::optional<VSAValue> run(std::string* error) {
    VSAValue v;
    skip();
    if (!value(v, 0)) return fail(error);
    skip();
    if (i_ != t_.size()) {
      why_ = "trailing characters";
      return fail(error);
    }
    return v;
  }

 private:
  std::optional<VSAValue> fail(std::string* error) {
    if (error) *error = why_ + " at offset " + std::to_string(i_);
    return std::nullopt;
  }
  bool bad(const char* why) {
    if (why_.empty()) why_ = why;
    return false;
  }
  void skip() {
    while (i_ < t_.size() && (t_[i_] == ' ' || t_[i_] == '\n' || t_[i_] == '\t' || t_[i_] == '\r'))
      ++i_;
  }
  bool literal(std::string_view word) {
    if (t_.substr(i_, word.size()) != word) return bad("unexpected word");
    i_ += word.size();
    return true;
  }
  bool value(VSAValue& out, int depth) {
    if (depth > 64) return bad("nesting too deep");
    if (i_ >= t_.size()) return bad("unexpected end");
    char c = t_[i_];
    if (c == '{') return object(out, depth);
    if (c == '[') return array(out, depth);
    if (c == '"') {
      std::string s;
      if (!string(s)) return false;
      out = VSAValue(std::move(s));
      return true;
    }
    if (c == 't') return literal("true") && (out = VSAValue(true), true);
    if (c == 'f') return literal("false") && (out = VSAValue(false), true);
    if (c == 'n') return literal("null") && (out = VSAValue(), true);
    return number(out);
  }
  bool number(VSAValue& out) {
    size_t start = i_;
    if (i_ < t_.size() && t_[i_] == '-') ++i_;
    bool real = false;
    while (i_ < t_.size() &&
           std::string_view("0123456789.eE+-").find(t_[i_]) != std::string_view::npos) {
      if (t_[i_] == '.' || t_[i_] == 'e' || t_[i_] == 'E') real = true;
      ++i_;
    }
    std::string text(t_.substr(start, i_ - start));
    if (text.empty() || text == "-") return bad("expected a value");
    char* end = nullptr;
    errno = 0;
    if (real) {
      double d = std::strtod(text.c_str(), &end);
      if (*end) return bad("bad number");
      out = VSAValue(d);
    } else if (text[0] == '-') {
      long long v = std::strtoll(text.c_str(), &end, 10);
      if (*end || errno) return bad("bad integer");
      out = VSAValue(static_cast<int64_t>(v));
    } else {
      unsigned long long v = std::strtoull(text.c_str(), &end, 10);
      if (*end || errno) return bad("bad integer");
      out = VSAValue(static_cast<uint64_t>(v));
    }
    return true;
  }
  bool hex4(uint32_t& v) {
    if (i_ + 4 > t_.size()) return bad("short \\u escape");
    v = 0;
    for (int k = 0; k < 4; ++k) {
      char c = t_[i_++];
      v <<= 4;
      if (c >= '0' && c <= '9')
        v |= c - '0';
      else if (c >= 'a' && c <= 'f')
        v |= c - 'a' + 10;
      else if (c >= 'A' && c <= 'F')
        v |= c - 'A' + 10;
      else
        return bad("bad \\u escape");
    }
    return true;
  }
  bool string(std::string& s) {
    ++i_;  // opening quote
    while (i_ < t_.size()) {
      char c = t_[i_++];
      if (c == '"') return true;
      if (static_cast<unsigned char>(c) < 0x20) return bad("control character in string");
      if (c != '\\') {
        s += c;
        continue;
      }
      if (i_ >= t_.size()) break;
      char e = t_[i_++];
      switch (e) {
        case '"':
          s += '"';
          break;
        case '\\':
          s += '\\';
          break;
        case '/':
          s += '/';
          break;
        case 'b':
          s += '\b';
          break;
        case 'f':
          s += '\f';
          break;
        case 'n':
          s += '\n';
          break;
        case 'r':
          s += '\r';
          break;
        case 't':
          s += '\t';
          break;
        case 'u': {
          uint32_t cp;
          if (!hex4(cp)) return false;
          if (cp >= 0xD800 && cp <= 0xDBFF) {
            uint32_t lo;
            if (t_.substr(i_, 2) != "\\u") return bad("unpaired surrogate");
            i_ += 2;
            if (!hex4(lo) || lo < 0xDC00 || lo > 0xDFFF) return bad("unpaired surrogate");
            cp = 0x10000 + ((cp - 0xD800) << 10) + (lo - 0xDC00);
          } else if (cp >= 0xDC00 && cp <= 0xDFFF) {
            return bad("unpaired surrogate");
          }
          VSAAppendUTF8(s, cp);
          break;
        }
        default:
          return bad("bad escape");
      }
    }
    return bad("unterminated string");
  }
  bool array(VSAValue& out, int depth) {
    ++i_;
    VSAValue::Array a;
    skip();
    if (i_ < t_.size() && t_[i_] == ']') {
      ++i_;
      out = VSAValue(std::move(a));
      return true;
    }
    for (;;) {
      skip();
      VSAValue v;
      if (!value(v, depth + 1)) return false;
      a.push_back(std::move(v));
      skip();
      if (i_ < t_.size() && t_[i_] == ',') {
        ++i_;
        continue;
      }
      if (i_ < t_.size() && t_[i_] == ']') {
        ++i_;
        out = VSAValue(std::move(a));
        return true;
      }
      return bad("expected ',' or ']'");
    }
  }
  bool object(VSAValue& out, int depth) {
    ++i_;
    VSAValue::Dictionary d;
    skip();
    if (i_ < t_.size() && t_[i_] == '}') {
      ++i_;
      out = VSAValue(std::move(d));
      return true;
    }
    for (;;) {
      skip();
      std::string key;
      if (i_ >= t_.size() || t_[i_] != '"' || !string(key)) return bad("expected a key");
      skip();
      if (i_ >= t_.size() || t_[i_++] != ':') return bad("expected ':'");
      skip();
      VSAValue v;
      if (!value(v, depth + 1)) return false;
      d[key] = std::move(v);
      skip();
      if (i_ < t_.size() && t_[i_] == ',') {
        ++i_;
        continue;
      }
      if (i_ < t_.size() && t_[i_] == '}') {
        ++i_;
        out = VSAValue(std::move(d));
        return true;
      }
      return bad("expected ',' or '}'");
    }
  }

  std::string_view t_;
  size_t i_ = 0;
  std::string why_;
};

void quote(std::string& out, const std::string& s) {
  out += '"';
  for (unsigned char c : s) {
    switch (c) {
      case '"':
        out += "\\\"";
        break;
      case '\\':
        out += "\\\\";
        break;
      case '\n':
        out += "\\n";
        break;
      case '\r':
        out += "\\r";
        break;
      case '\t':
        out += "\\t";
        break;
      default:
        if (c < 0x20) {
          char buf[8];
          std::snprintf(buf, sizeof buf, "\\u%04x", c);
          out += buf;
        } else {
          out += static_cast<char>(c);
        }
    }
  }
  out += '"';
}

void print(std::string& out, const VSAValue& v, bool pretty, int indent) {
  std::string nl = pretty ? "\n" + std::string((indent + 1) * 2, ' ') : "";
  std::string end = pretty ? "\n" + std::string(indent * 2, ' ') : "";
  switch (v.type()) {
    case VSAValue::Type::Null:
      out += "null";
      break;
    case VSAValue::Type::Bool:
      out += *v.boolValue() ? "true" : "false";
      break;
    case VSAValue::Type::Int:
      out += std::to_string(*v.int64Value());
      break;
    case VSAValue::Type::UInt:
      out += std::to_string(*v.uint64Value());
      break;
    case VSAValue::Type::Real: {
      double d = *v.doubleValue();
      if (!std::isfinite(d)) {
        out += "null";
        break;
      }
      char buf[64];
      std::snprintf(buf, sizeof buf, "%.17g", d);
      out += buf;
      break;
    }
    case VSAValue::Type::String:
      quote(out, *v.stringValue());
      break;
    case VSAValue::Type::UUID:
      quote(out, v.uuidValue()->string());
      break;
    case VSAValue::Type::Data: {
      static const char* hex = "0123456789abcdef";
      out += "{\"$data\": \"";
      for (uint8_t c : *v.dataValue()) {
        out += hex[c >> 4];
        out += hex[c & 15];
      }
      out += "\"}";
      break;
    }
    case VSAValue::Type::Date: {
      char buf[64];
      std::snprintf(buf, sizeof buf, "{\"$date\": %.3f}", v.dateValue()->secondsSince1970());
      out += buf;
      break;
    }
    case VSAValue::Type::Array: {
      const auto& a = *v.arrayValue();
      if (a.empty()) {
        out += "[]";
        break;
      }
      out += "[";
      for (size_t i = 0; i < a.size(); ++i) {
        out += nl;
        print(out, a[i], pretty, indent + 1);
        if (i + 1 < a.size()) out += ",";
      }
      out += end + "]";
      break;
    }
    case VSAValue::Type::Dictionary: {
      const auto& d = *v.dictionaryValue();
      if (d.empty()) {
        out += "{}";
        break;
      }
      out += "{";
      size_t i = 0;
      for (const auto& [k, c] : d) {
        out += nl;
        quote(out, k);
        out += pretty ? ": " : ":";
        print(out, c, pretty, indent + 1);
        if (++i < d.size()) out += ",";
      }
      out += end + "}";
      break;
    }
  }
}

}  // namespace

std::optional<VSAValue> VSAJSON::parse(std::string_view text, std::string* error) {
  return Parser(text).run(error);
}

std::string VSAJSON::print(const VSAValue& value, bool pretty) {
  std::string out;
  ::print(out, value, pretty, 0);
  return out;
}
