// Binary property list ("bplist00") encoder and hardened decoder.
//
// The decoder reads untrusted bytes from the socket, so it checks every
// offset and count against the buffer, refuses reference cycles, bounds the
// nesting depth and the number of decoded values (a small file of shared
// references cannot expand into a huge tree), and never reads out of bounds.
//
// Integers keep their signedness: negative values are written as 8-byte
// signed integers and unsigned values above INT64_MAX as 16-byte integers,
// so both extremes survive a round trip. UUIDs are written as 16 bytes of
// data (wire form) or as their text (file form). Stateless and thread-safe.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAValue.h"

class VSABinaryPlist {
 public:
  enum class UUIDForm { Data, String };

  static constexpr int kMaxDepth = 64;
  static constexpr size_t kMaxDecodedValues = 1u << 20;

  static bool isBinaryPlist(const uint8_t* bytes, size_t length);

  // Fails (with a message in `error`) only for a string that is not UTF-8.
  static std::optional<std::vector<uint8_t>> encode(const VSAValue& value, UUIDForm uuidForm,
                                                    std::string* error);
  static std::optional<VSAValue> decode(const uint8_t* bytes, size_t length, std::string* error);
};
