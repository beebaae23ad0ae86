// The one value type of requests, replies, info dictionaries, entitlements
// and code-signing information: null, bool, signed and unsigned 64-bit
// integers, double, string, data, date, UUID, array and dictionary.
//
// Accessors are lenient where the wire is: `uint64Value()` accepts a
// non-negative signed integer, `uuidValue()` accepts a UUID, 16 bytes of
// data or the UUID text form (UUIDs travel as data on the wire and as text in
// files). Integers compare equal across signedness when their values match.
// A VSAValue is a plain value: copying copies; not synchronised.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "base/VSAUUID.h"

// Seconds since 2001-01-01 00:00:00 UTC, as property lists store dates.
struct VSADate {
  double secondsSinceReferenceDate = 0;
  static VSADate now();
  double secondsSince1970() const { return secondsSinceReferenceDate + 978307200.0; }
  friend bool operator==(const VSADate&, const VSADate&) = default;
};

class VSAValue {
 public:
  enum class Type { Null, Bool, Int, UInt, Real, String, Data, Date, UUID, Array, Dictionary };
  using Array = std::vector<VSAValue>;
  // Transparent comparison: a key given as text or a view is looked up
  // without building a string (most keys are longer than the short-string
  // buffer, so each look-up would allocate).
  using Dictionary = std::map<std::string, VSAValue, std::less<>>;
  using Data = std::vector<uint8_t>;

  VSAValue() = default;
  VSAValue(std::nullptr_t) {}
  VSAValue(bool v) : v_(v) {}
  VSAValue(int v) : v_(static_cast<int64_t>(v)) {}
  VSAValue(long v) : v_(static_cast<int64_t>(v)) {}
  VSAValue(long long v) : v_(static_cast<int64_t>(v)) {}
  VSAValue(unsigned v) : v_(static_cast<uint64_t>(v)) {}
  VSAValue(unsigned long v) : v_(static_cast<uint64_t>(v)) {}
  VSAValue(unsigned long long v) : v_(static_cast<uint64_t>(v)) {}
  VSAValue(double v) : v_(v) {}
  VSAValue(const char* v) : v_(std::string(v)) {}
  VSAValue(std::string v) : v_(std::move(v)) {}
  VSAValue(Data v) : v_(std::move(v)) {}
  VSAValue(VSADate v) : v_(v) {}
  VSAValue(VSAUUID v) : v_(v) {}
  VSAValue(Array v) : v_(std::move(v)) {}
  VSAValue(Dictionary v) : v_(std::move(v)) {}

  static VSAValue dictionary() { return VSAValue(Dictionary{}); }
  static VSAValue array() { return VSAValue(Array{}); }

  Type type() const { return static_cast<Type>(v_.index()); }
  bool isNull() const { return type() == Type::Null; }
  bool isBool() const { return type() == Type::Bool; }
  bool isNumber() const;  // bool, integer or real
  bool isInteger() const { return type() == Type::Int || type() == Type::UInt; }
  bool isString() const { return type() == Type::String; }
  bool isData() const { return type() == Type::Data; }
  bool isArray() const { return type() == Type::Array; }
  bool isDictionary() const { return type() == Type::Dictionary; }

  // Exact reads: nothing when the value is of another kind or out of range.
  std::optional<uint64_t> uint64Value() const;
  std::optional<int64_t> int64Value() const;
  std::optional<double> doubleValue() const;
  std::optional<bool> boolValue() const;  // a bool, or the truth value of a number
  std::optional<VSAUUID> uuidValue() const;
  std::optional<VSADate> dateValue() const;
  const std::string* stringValue() const;
  const Data* dataValue() const;
  const Array* arrayValue() const;
  const Dictionary* dictionaryValue() const;
  Array* mutableArray();
  Dictionary* mutableDictionary();

  // Dictionary helpers; `get` answers null for a missing key or a non-dictionary.
  const VSAValue* get(std::string_view key) const;
  void set(const std::string& key, VSAValue value);  // turns a null value into a dictionary
  bool remove(const std::string& key);
  // Array helper; turns a null value into an array.
  void append(VSAValue value);

  // A property-list style description ({ key = value; }), used by "%@".
  std::string description() const;

  friend bool operator==(const VSAValue& a, const VSAValue& b);

 private:
  void describe(std::string& out, int indent) const;
  std::variant<std::monostate, bool, int64_t, uint64_t, double, std::string, Data, VSADate, VSAUUID,
               Array, Dictionary>
      v_;
};
