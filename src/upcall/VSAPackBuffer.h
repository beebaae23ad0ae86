// The pack buffer ("packbuff"): the tagged, 8-byte-aligned item list in
// which the kernel's sandbox asks for a launching process's containers and
// in which the daemon answers. A C-style module: an opaque buffer, a write
// cursor that always rests on the 8-byte end item, and a read cursor that
// walks items one by one (the same `item` pointer; a buffer is either
// written or read).
//
// Wire format (host byte order): items at 8-byte boundaries, each
//   u16 item type (0 end, 1 inline u32, 2 string, 3 bytes), u16 value type,
//   u32 inline value or data length (a string's length counts its NUL),
//   then for types 2 and 3 the data and zero padding to a multiple of 8.
// The end item is 8 zero bytes; an empty buffer is exactly one end item.
//
// Errors are errno values (EINVAL, ERANGE, ENOMEM, ENOTSUP), never result
// codes. A failed pack leaves the buffer as it was. Reading never copies:
// unpacked strings and byte runs point into the storage. Storage received
// from a peer is hostile: every read checks that the whole item header and
// data lie inside the storage before touching them. Not synchronised.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>

// How the item storage is released by sb_packbuff_free.
enum : uint32_t {
  SB_PACKBUFF_DEALLOC_NONE = 0,  // not at all (caller storage)
  SB_PACKBUFF_DEALLOC_FREE = 1,  // module-allocated heap storage: free()
  SB_PACKBUFF_DEALLOC_VM = 2,    // storage mapped from a peer's memfd: munmap(bytes_allocated)
};

enum : uint16_t {
  SB_PACKBUFF_ITEM_END = 0,
  SB_PACKBUFF_ITEM_UINT32 = 1,
  SB_PACKBUFF_ITEM_STRING = 2,
  SB_PACKBUFF_ITEM_BYTES = 3,
};

inline constexpr size_t SB_PACKBUFF_DEFAULT_BLOCK_SIZE = 256;

struct sb_packbuff {
  uint32_t dealloc_type;
  uint64_t block_size;
  uint64_t bytes_allocated;
  uint64_t bytes_remaining;
  uint64_t bytes_used;
  uint8_t* item_buffer;
  uint8_t* item;  // writing: the end item; reading: the next item
};

// A growable buffer holding only the end item (block size 256 when asked
// for less than 8), or null when memory is short. The tag only names the
// buffer's owner for debugging.
sb_packbuff* sb_packbuff_new(size_t block_size);
sb_packbuff* sb_packbuff_new_with_tag(size_t block_size, const char* tag);
// A buffer over caller storage (never grown: packing beyond it is ENOTSUP).
// With `holds_items` the storage is read from its start and bytes used is
// `size`; without, its first 8 bytes become the end item (`size` >= 8).
sb_packbuff* sb_packbuff_init_with_buffer(void* storage, size_t size, bool holds_items,
                                          uint32_t dealloc_type);
sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* storage, size_t size, bool holds_items,
                                                  uint32_t dealloc_type, const char* tag);
// Releases the storage as the dealloc type says, then the object (null is fine).
void sb_packbuff_free(sb_packbuff* buffer);

void* sb_packbuff_get_bytes(const sb_packbuff* buffer);
size_t sb_packbuff_get_size(const sb_packbuff* buffer);  // bytes used
void sb_packbuff_set_size(sb_packbuff* buffer, size_t size);

// 0 or an errno. A string's byte at `length` must be its NUL.
int sb_packbuff_pack_uint32(sb_packbuff* buffer, uint16_t value_type, uint32_t value);
int sb_packbuff_pack_string(sb_packbuff* buffer, uint16_t value_type, const char* text,
                            size_t length);
int sb_packbuff_pack_bytes(sb_packbuff* buffer, uint16_t value_type, const void* data,
                           size_t length);
// Two string items, the key's first.
int sb_packbuff_pack_key_with_string_value(sb_packbuff* buffer, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value);

// False at the end item (or when the cursor is outside the storage);
// otherwise the value type of the item under the read cursor, which stays.
bool sb_packbuff_get_item_value_type(const sb_packbuff* buffer, uint16_t* value_type);
// The value (0 on error); `error` gets 0 or an errno. ERANGE when the item
// after it would lie outside the storage (the value is still returned).
uint32_t sb_packbuff_unpack_uint32(sb_packbuff* buffer, int* error);
// The text inside the storage; `length` excludes the NUL.
const char* sb_packbuff_unpack_string(sb_packbuff* buffer, size_t* length, int* error);
const void* sb_packbuff_unpack_bytes(sb_packbuff* buffer, size_t* length, int* error);
// Two string items; `value_type` is that of the value item.
int sb_packbuff_unpack_key_with_string_value(sb_packbuff* buffer, const char** key,
                                             uint16_t* value_type, const char** value,
                                             size_t* value_length);
// 0 or an errno; the end item and unknown item types cannot be skipped (EINVAL).
int sb_packbuff_skip_item(sb_packbuff* buffer);

// Debugging dump to standard output (sb_packbuff_print) or to `out`.
void sb_packbuff_print(const sb_packbuff* buffer);
void sb_packbuff_print_to(const sb_packbuff* buffer, FILE* out);
