#include "base/VSAValue.h"

#include <chrono>
#include <cmath>
#include <cstdio>
#include <limits>

VSADate VSADate::now() {
  using namespace std::chrono;
  double unix = duration<double>(system_clock::now().time_since_epoch()).count();
  return VSADate{unix - 978307200.0};
}

bool VSAValue::isNumber() const {
  Type t = type();
  return t == Type::Bool || t == Type::Int || t == Type::UInt || t == Type::Real;
}

std::optional<uint64_t> VSAValue::uint64Value() const {
  if (auto p = std::get_if<uint64_t>(&v_)) return *p;
  if (auto p = std::get_if<int64_t>(&v_))
    if (*p >= 0) return static_cast<uint64_t>(*p);
  return std::nullopt;
}

std::optional<int64_t> VSAValue::int64Value() const {
  if (auto p = std::get_if<int64_t>(&v_)) return *p;
  if (auto p = std::get_if<uint64_t>(&v_))
    if (*p <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
      return static_cast<int64_t>(*p);
  return std::nullopt;
}

std::optional<double> VSAValue::doubleValue() const {
  if (auto p = std::get_if<double>(&v_)) return *p;
  if (auto p = std::get_if<int64_t>(&v_)) return static_cast<double>(*p);
  if (auto p = std::get_if<uint64_t>(&v_)) return static_cast<double>(*p);
  return std::nullopt;
}

std::optional<bool> VSAValue::boolValue() const {
  if (auto p = std::get_if<bool>(&v_)) return *p;
  if (auto p = std::get_if<int64_t>(&v_)) return *p != 0;
  if (auto p = std::get_if<uint64_t>(&v_)) return *p != 0;
  if (auto p = std::get_if<double>(&v_)) return *p != 0.0;
  return std::nullopt;
}

std::optional<VSAUUID> VSAValue::uuidValue() const {
  if (auto p = std::get_if<VSAUUID>(&v_)) return *p;
  if (auto p = std::get_if<Data>(&v_)) {
    if (p->size() != 16) return std::nullopt;
    VSAUUID::Bytes b;
    std::copy(p->begin(), p->end(), b.begin());
    return VSAUUID(b);
  }
  if (auto p = std::get_if<std::string>(&v_)) return VSAUUID::parse(*p);
  return std::nullopt;
}

std::optional<VSADate> VSAValue::dateValue() const {
  if (auto p = std::get_if<VSADate>(&v_)) return *p;
  return std::nullopt;
}

const std::string* VSAValue::stringValue() const { return std::get_if<std::string>(&v_); }
const VSAValue::Data* VSAValue::dataValue() const { return std::get_if<Data>(&v_); }
const VSAValue::Array* VSAValue::arrayValue() const { return std::get_if<Array>(&v_); }
const VSAValue::Dictionary* VSAValue::dictionaryValue() const {
  return std::get_if<Dictionary>(&v_);
}
VSAValue::Array* VSAValue::mutableArray() { return std::get_if<Array>(&v_); }
VSAValue::Dictionary* VSAValue::mutableDictionary() { return std::get_if<Dictionary>(&v_); }

const VSAValue* VSAValue::get(std::string_view key) const {
  auto d = dictionaryValue();
  if (!d) return nullptr;
  auto it = d->find(key);
  return it == d->end() ? nullptr : &it->second;
}

void VSAValue::set(const std::string& key, VSAValue value) {
  if (isNull()) v_ = Dictionary{};
  if (auto d = mutableDictionary()) (*d)[key] = std::move(value);
}

bool VSAValue::remove(const std::string& key) {
  auto d = mutableDictionary();
  return d && d->erase(key) > 0;
}

void VSAValue::append(VSAValue value) {
  if (isNull()) v_ = Array{};
  if (auto a = mutableArray()) a->push_back(std::move(value));
}

bool operator==(const VSAValue& a, const VSAValue& b) {
  if (a.isInteger() && b.isInteger()) {
    auto ai = a.int64Value(), bi = b.int64Value();
    if (ai && bi) return *ai == *bi;
    auto au = a.uint64Value(), bu = b.uint64Value();
    return au && bu && *au == *bu;
  }
  return a.v_ == b.v_;
}

namespace {

bool needsQuotes(const std::string& s) {
  if (s.empty()) return true;
  for (unsigned char c : s)
    if (!(isalnum(c) || c == '.' || c == '_' || c == '-' || c == '/' || c == ':')) return true;
  return false;
}

std::string quoted(const std::string& s) {
  if (!needsQuotes(s)) return s;
  std::string out = "\"";
  for (char c : s) {
    if (c == '"' || c == '\\') out += '\\';
    out += c;
  }
  return out + "\"";
}

}  // namespace

void VSAValue::describe(std::string& out, int indent) const {
  std::string pad(indent * 4, ' ');
  switch (type()) {
    case Type::Null:
      out += "<null>";
      break;
    case Type::Bool:
      out += std::get<bool>(v_) ? "1" : "0";
      break;
    case Type::Int:
      out += std::to_string(std::get<int64_t>(v_));
      break;
    case Type::UInt:
      out += std::to_string(std::get<uint64_t>(v_));
      break;
    case Type::Real: {
      char buf[64];
      std::snprintf(buf, sizeof buf, "%.17g", std::get<double>(v_));
      out += buf;
      break;
    }
    case Type::String:
      out += quoted(std::get<std::string>(v_));
      break;
    case Type::Data: {
      static const char* hex = "0123456789abcdef";
      out += "{length = " + std::to_string(std::get<Data>(v_).size()) + ", bytes = 0x";
      size_t n = 0;
      for (uint8_t c : std::get<Data>(v_)) {
        if (n++ == 32) {
          out += "...";
          break;
        }
        out += hex[c >> 4];
        out += hex[c & 15];
      }
      out += "}";
      break;
    }
    case Type::Date: {
      char buf[64];
      std::snprintf(buf, sizeof buf, "<date %.3f>", std::get<VSADate>(v_).secondsSince1970());
      out += buf;
      break;
    }
    case Type::UUID:
      out += std::get<VSAUUID>(v_).string();
      break;
    case Type::Array: {
      out += "(\n";
      const auto& a = std::get<Array>(v_);
      for (size_t i = 0; i < a.size(); ++i) {
        out += pad + "    ";
        a[i].describe(out, indent + 1);
        out += i + 1 < a.size() ? ",\n" : "\n";
      }
      out += pad + ")";
      break;
    }
    case Type::Dictionary: {
      out += "{\n";
      for (const auto& [k, v] : std::get<Dictionary>(v_)) {
        out += pad + "    " + quoted(k) + " = ";
        v.describe(out, indent + 1);
        out += ";\n";
      }
      out += pad + "}";
      break;
    }
  }
}

std::string VSAValue::description() const {
  std::string out;
  describe(out, 0);
  return out;
}
