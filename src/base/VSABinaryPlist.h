// Binary property list ("bplist00") encoder and hardened decoder.
//
// The decoder reads untrusted bytes from the socket, so it checks every
// offset and count against the buffer, refuses reference cycles, bounds the
// nesting depth and the number of decoded values, and never reads out of
// bounds. Binary lists share objects by reference, so a small input can name
// one large string a million times: the decoder also keeps a byte budget.
// Every decoded value is charged kValueCost bytes plus its payload (the UTF-8
// bytes of a string or dictionary key, the bytes of a data object), again at
// each reference to the same object, and decoding stops once the charge
// exceeds decodedSizeBudget(input length) = 8 x input + 64 KiB. A list whose
// objects are not shared costs at most about 3 x its size, so only shared
// payloads or shared collections can reach the budget. The heap a decoded
// tree takes is at most a small constant times its charge. An allocation
// failure while decoding is reported as a decode failure, never thrown.
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

  // Collections nested deeper than this are refused (the decoder recurses).
  static constexpr int kMaxDepth = 64;
  static constexpr size_t kMaxDecodedValues = 1u << 20;
  // The byte budget: what one value costs besides its payload, and the
  // decoded bytes allowed per input byte plus a fixed allowance for small
  // inputs.
  static constexpr size_t kValueCost = 8;
  static constexpr size_t kDecodedBytesPerInputByte = 8;
  static constexpr size_t kDecodedBytesAllowance = 64u << 10;

  static size_t decodedSizeBudget(size_t inputLength);
  // What `value` costs as the budget counts it (each value kValueCost bytes
  // plus its string, key or data bytes). A decode of `length` bytes never
  // returns a value whose decodedSize exceeds decodedSizeBudget(length).
  static size_t decodedSize(const VSAValue& value);

  static bool isBinaryPlist(const uint8_t* bytes, size_t length);

  // Fails (with a message in `error`) only for a string that is not UTF-8.
  static std::optional<std::vector<uint8_t>> encode(const VSAValue& value, UUIDForm uuidForm,
                                                    std::string* error);
  static std::optional<VSAValue> decode(const uint8_t* bytes, size_t length, std::string* error);
};
