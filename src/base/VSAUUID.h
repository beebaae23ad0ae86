// A 16-byte UUID with its standard upper-case text form.
//
// Container directories are named by the text form and identifier locks are
// keyed by it, so `string()` is always upper-case
// ("XXXXXXXX-XXXX-XXXX-XXXX-XXXXXXXXXXXX"); `parse` accepts either case.
// Value type, thread-safe.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

class VSAUUID {
 public:
  using Bytes = std::array<uint8_t, 16>;

  VSAUUID() : bytes_{} {}
  explicit VSAUUID(const Bytes& bytes) : bytes_(bytes) {}

  // A fresh random (version 4) UUID.
  static VSAUUID random();
  // Parses the 36-character text form; nothing for anything else.
  static std::optional<VSAUUID> parse(std::string_view text);

  const Bytes& bytes() const { return bytes_; }
  std::string string() const;
  std::string description() const { return string(); }
  bool isNull() const;

  friend bool operator==(const VSAUUID&, const VSAUUID&) = default;
  friend auto operator<=>(const VSAUUID&, const VSAUUID&) = default;

 private:
  Bytes bytes_;
};
