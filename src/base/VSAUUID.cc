#include "base/VSAUUID.h"

#include <uuid/uuid.h>

#include <array>
#include <cstdint>

VSAUUID VSAUUID::random() {
  Bytes b;
  uuid_generate_random(b.data());
  return VSAUUID(b);
}

namespace {
// Hex digit values by byte, -1 for every byte that is not one.
constexpr std::array<int8_t, 256> kHexValues = [] {
  std::array<int8_t, 256> t{};
  for (int i = 0; i < 256; ++i) {
    t[i] = i >= '0' && i <= '9'   ? static_cast<int8_t>(i - '0')
           : i >= 'a' && i <= 'f' ? static_cast<int8_t>(i - 'a' + 10)
           : i >= 'A' && i <= 'F' ? static_cast<int8_t>(i - 'A' + 10)
                                  : int8_t{-1};
  }
  return t;
}();

int hexValue(char c) { return kHexValues[static_cast<uint8_t>(c)]; }
}  // namespace

// The 8-4-4-4-12 text form, hex digits in either case. Parsed by hand: a
// class-map build parses two per container (the directory's name and the
// metadata's UUID).
std::optional<VSAUUID> VSAUUID::parse(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  Bytes b;
  size_t i = 0;
  for (uint8_t& byte : b) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      ++i;
    }
    int hi = hexValue(text[i]), lo = hexValue(text[i + 1]);
    if (hi < 0 || lo < 0) return std::nullopt;
    byte = static_cast<uint8_t>(hi << 4 | lo);
    i += 2;
  }
  return VSAUUID(b);
}

std::string VSAUUID::string() const {
  char buf[37];
  uuid_unparse_upper(bytes_.data(), buf);
  return std::string(buf, 36);
}

bool VSAUUID::isNull() const {
  for (uint8_t c : bytes_)
    if (c) return false;
  return true;
}
