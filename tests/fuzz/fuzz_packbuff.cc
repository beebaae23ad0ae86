// Fuzzes what a peer can hand over: a pack buffer's storage, walked item by
// item with every reader and dumped; whatever reads is packed again into a
// growable buffer and must read back the same.
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "upcall/VSAPackBuffer.h"

namespace {

enum class Kind { UInt32, String, Bytes, KeyValue };

// One item (or key/value pair) as read; pointers point into the storage.
struct Read {
  Kind kind;
  uint16_t valueType;
  uint32_t value;
  const char* data;
  size_t length;
  uint16_t secondValueType;  // key/value: the value item's
  const char* second;
};

void check(bool condition) {
  if (!condition) __builtin_trap();
}

FILE* devNull() {
  static FILE* out = std::fopen("/dev/null", "w");
  return out;
}

bool inside(const uint8_t* storage, size_t size, const void* p, size_t length) {
  const auto* q = static_cast<const uint8_t*>(p);
  return q >= storage && q <= storage + size && length <= static_cast<size_t>(storage + size - q);
}

uint16_t itemTypeAtCursor(const sb_packbuff* b) {
  uint16_t type;
  std::memcpy(&type, b->item, sizeof type);
  return type;
}

// Walks `b` to its end or first error; every refusal must leave the cursor.
// With `probe`, reads of the wrong type are tried first and must be refused.
std::vector<Read> walk(sb_packbuff* b, const uint8_t* storage, size_t size, bool probe) {
  std::vector<Read> reads;
  for (;;) {
    uint16_t valueType = 0;
    if (!sb_packbuff_get_item_value_type(b, &valueType)) {
      // Past the end item, or the header leaves the storage: nothing reads.
      int error = 0;
      (void)sb_packbuff_unpack_uint32(b, &error);
      check(error != 0);
      check(sb_packbuff_skip_item(b) != 0);
      return reads;
    }
    uint8_t* const before = b->item;
    check(inside(storage, size, before, 8));
    const uint16_t type = itemTypeAtCursor(b);
    int error = 0;
    size_t length = 0;

    if (probe && type != SB_PACKBUFF_ITEM_UINT32) {
      (void)sb_packbuff_unpack_uint32(b, &error);
      check(error == EINVAL || error == ERANGE);
      check(b->item == before);
    }
    if (probe && type != SB_PACKBUFF_ITEM_STRING) {
      check(sb_packbuff_unpack_string(b, &length, &error) == nullptr);
      check(error == EINVAL || error == ERANGE);
      check(b->item == before);
    }

    // Some items are skipped rather than read.
    if (valueType % 7 == 3) {
      error = sb_packbuff_skip_item(b);
      if (error != 0) {
        check(b->item == before);
        return reads;
      }
      check(b->item > before && (b->item - before) % 8 == 0);
      continue;
    }

    switch (type) {
      case SB_PACKBUFF_ITEM_UINT32: {
        const uint32_t value = sb_packbuff_unpack_uint32(b, &error);
        if (error != 0) {
          check(error == ERANGE);  // nothing after it inside the storage
          check(b->item == before);
          return reads;
        }
        check(b->item == before + 8);
        reads.push_back({Kind::UInt32, valueType, value, nullptr, 0, 0, nullptr});
        break;
      }
      case SB_PACKBUFF_ITEM_STRING: {
        if (valueType % 2 == 1) {
          const char* key = nullptr;
          const char* value = nullptr;
          uint16_t secondType = 0;
          error = sb_packbuff_unpack_key_with_string_value(b, &key, &secondType, &value, &length);
          if (error != 0) return reads;
          check(inside(storage, size, key, std::strlen(key) + 1));
          check(inside(storage, size, value, length + 1) && value[length] == '\0');
          reads.push_back({Kind::KeyValue, valueType, 0, key, std::strlen(key), secondType, value});
          break;
        }
        const char* text = sb_packbuff_unpack_string(b, &length, &error);
        if (error != 0) {
          check(text == nullptr && (error == EINVAL || error == ERANGE));
          check(b->item == before);
          return reads;
        }
        check(inside(storage, size, text, length + 1) && text[length] == '\0');
        check(text == reinterpret_cast<const char*>(before + 8));
        reads.push_back({Kind::String, valueType, 0, text, length, 0, nullptr});
        break;
      }
      case SB_PACKBUFF_ITEM_BYTES: {
        const void* data = sb_packbuff_unpack_bytes(b, &length, &error);
        if (error != 0) {
          check(data == nullptr && error == ERANGE);
          check(b->item == before);
          return reads;
        }
        check(inside(storage, size, data, length));
        reads.push_back(
            {Kind::Bytes, valueType, 0, static_cast<const char*>(data), length, 0, nullptr});
        break;
      }
      default:
        // The end item or an unknown type: neither reads nor skips.
        check(sb_packbuff_skip_item(b) == EINVAL);
        check(sb_packbuff_unpack_bytes(b, &length, &error) == nullptr && error == EINVAL);
        check(b->item == before);
        return reads;
    }
  }
}

void pack(sb_packbuff* out, const Read& r) {
  switch (r.kind) {
    case Kind::UInt32:
      check(sb_packbuff_pack_uint32(out, r.valueType, r.value) == 0);
      break;
    case Kind::String:
      check(sb_packbuff_pack_string(out, r.valueType, r.data, r.length) == 0);
      break;
    case Kind::Bytes:
      check(sb_packbuff_pack_bytes(out, r.valueType, r.data, r.length) == 0);
      break;
    case Kind::KeyValue:
      check(sb_packbuff_pack_key_with_string_value(out, r.valueType, r.data, r.secondValueType,
                                                   r.second) == 0);
      break;
  }
}

// Reads `r` back from `in`, which was packed from it.
void expectSame(sb_packbuff* in, const Read& r) {
  uint16_t valueType = 0;
  check(sb_packbuff_get_item_value_type(in, &valueType) && valueType == r.valueType);
  int error = 0;
  size_t length = 0;
  switch (r.kind) {
    case Kind::UInt32:
      check(sb_packbuff_unpack_uint32(in, &error) == r.value && error == 0);
      break;
    case Kind::String: {
      const char* text = sb_packbuff_unpack_string(in, &length, &error);
      check(error == 0 && length == r.length && std::memcmp(text, r.data, length + 1) == 0);
      break;
    }
    case Kind::Bytes: {
      const void* data = sb_packbuff_unpack_bytes(in, &length, &error);
      check(error == 0 && length == r.length);
      check(length == 0 || std::memcmp(data, r.data, length) == 0);
      break;
    }
    case Kind::KeyValue: {
      const char* key = nullptr;
      const char* value = nullptr;
      uint16_t secondType = 0;
      check(sb_packbuff_unpack_key_with_string_value(in, &key, &secondType, &value, &length) == 0);
      // Packing takes both strings up to their first NUL.
      check(std::strcmp(key, r.data) == 0 && secondType == r.secondValueType);
      check(std::strcmp(value, r.second) == 0 && length == std::strlen(r.second));
      break;
    }
  }
}

size_t stringItemSize(size_t length) { return 8 + ((length + 1 + 7) & ~size_t{7}); }

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // Storage of exactly the input's size (malloc aligns it to at least 8).
  auto* storage = static_cast<uint8_t*>(std::malloc(size == 0 ? 1 : size));
  if (storage == nullptr) return 0;
  if (size != 0) std::memcpy(storage, data, size);

  sb_packbuff* in = sb_packbuff_init_with_buffer(storage, size, true, SB_PACKBUFF_DEALLOC_NONE);
  check(in != nullptr);
  sb_packbuff_print_to(in, devNull());
  const std::vector<Read> reads = walk(in, storage, size, (size & 1) != 0);
  sb_packbuff_print_to(in, devNull());  // with the cursor where the walk stopped

  // Small block sizes make every few items grow the buffer.
  sb_packbuff* out = sb_packbuff_new((size % 5) * 8);
  check(out != nullptr);
  size_t expectedSize = 8;
  for (const Read& r : reads) {
    pack(out, r);
    switch (r.kind) {
      case Kind::UInt32:
        expectedSize += 8;
        break;
      case Kind::String:
        expectedSize += stringItemSize(r.length);
        break;
      case Kind::Bytes:
        expectedSize += 8 + ((r.length + 7) & ~size_t{7});
        break;
      case Kind::KeyValue:
        expectedSize += stringItemSize(r.length) + stringItemSize(std::strlen(r.second));
        break;
    }
  }
  check(sb_packbuff_get_size(out) == expectedSize);
  check(out->item == out->item_buffer + expectedSize - 8);
  sb_packbuff_print_to(out, devNull());

  sb_packbuff* back = sb_packbuff_init_with_buffer(
      sb_packbuff_get_bytes(out), sb_packbuff_get_size(out), true, SB_PACKBUFF_DEALLOC_NONE);
  check(back != nullptr);
  for (const Read& r : reads) expectSame(back, r);
  uint16_t valueType = 0;
  check(!sb_packbuff_get_item_value_type(back, &valueType));
  check(back->item == back->item_buffer + expectedSize - 8);

  sb_packbuff_free(back);
  sb_packbuff_free(out);
  sb_packbuff_free(in);
  std::free(storage);
  return 0;
}
