// The pack buffer: writing appends items over the end item, reading walks
// the items with bounds checks against the storage the buffer was given.
//
// Every field of the wire format is read and written with memcpy: caller
// storage need not be aligned, and storage from a peer is never trusted to
// be.
#include "upcall/VSAPackBuffer.h"

#include <sys/mman.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

namespace {

constexpr uint64_t BYTE_ALIGNMENT = 8;
constexpr uint64_t ITEM_HEADER_SIZE = 8;
// A padded data length at or above this is refused, so that header plus
// data always fit the 32-bit arithmetic of a peer reading the buffer.
constexpr uint32_t MAX_PADDED_LENGTH = 0xFFFFFFF8u;

struct ItemHeader {
  uint16_t type;
  uint16_t value_type;
  uint32_t value;  // the inline value, or the data length
};
static_assert(sizeof(ItemHeader) == ITEM_HEADER_SIZE);
static_assert(sizeof(size_t) == sizeof(uint64_t), "sizes are 64-bit");

// Programming errors (a caller passing no data for a data item, an item
// whose size breaks the alignment) end the process whatever the build type.
[[noreturn]] void packbuffCheckFailed(const char* expression, const char* file, int line) {
  std::fprintf(stderr, "packbuff: check failed: %s (%s:%d)\n", expression, file, line);
  std::abort();
}

#define SB_PACKBUFF_CHECK(condition) \
  ((condition) ? (void)0 : packbuffCheckFailed(#condition, __FILE__, __LINE__))

ItemHeader readHeader(const uint8_t* at) {
  ItemHeader h;
  std::memcpy(&h, at, sizeof h);
  return h;
}

void writeHeader(uint8_t* at, uint16_t type, uint16_t value_type, uint32_t value) {
  const ItemHeader h{type, value_type, value};
  std::memcpy(at, &h, sizeof h);
}

void writeEndItem(uint8_t* at) { std::memset(at, 0, ITEM_HEADER_SIZE); }

// Zero bytes after `length` bytes of data up to the next multiple of 8.
uint32_t padBytes(uint64_t length) {
  return static_cast<uint32_t>((BYTE_ALIGNMENT - length % BYTE_ALIGNMENT) % BYTE_ALIGNMENT);
}

// Header, data and padding of an item holding `length` data bytes; 64-bit
// so that no length from a peer can wrap it.
uint64_t dataItemSize(uint32_t length) {
  return ITEM_HEADER_SIZE + static_cast<uint64_t>(length) + padBytes(length);
}

// Space a data item of `length` bytes takes when packed: the padded
// length plus the header. ERANGE when the padded length wraps in 32 bits
// or reaches MAX_PADDED_LENGTH.
int packedDataItemSpace(uint32_t length, uint64_t* space) {
  const uint32_t padded = (length + 7u) & ~7u;
  if (padded < length || padded >= MAX_PADDED_LENGTH) return ERANGE;
  *space = static_cast<uint64_t>(padded) + ITEM_HEADER_SIZE;
  return 0;
}

// The cursor's offset into the storage, or false when the cursor lies
// outside [storage, storage + bytes_allocated). Compared as integers: the
// cursor of a damaged buffer need not point into the storage at all.
bool cursorOffset(const sb_packbuff* buffer, uint64_t* offset) {
  if (buffer->item_buffer == nullptr || buffer->item == nullptr) return false;
  const uintptr_t start = reinterpret_cast<uintptr_t>(buffer->item_buffer);
  const uintptr_t at = reinterpret_cast<uintptr_t>(buffer->item);
  if (at < start || at - start >= buffer->bytes_allocated) return false;
  *offset = at - start;
  return true;
}

// The header under the read cursor, when all 8 bytes of it lie inside the
// storage; ERANGE otherwise.
int headerAtCursor(const sb_packbuff* buffer, uint64_t* offset, ItemHeader* header) {
  if (!cursorOffset(buffer, offset)) return ERANGE;
  if (buffer->bytes_allocated - *offset < ITEM_HEADER_SIZE) return ERANGE;
  *header = readHeader(buffer->item);
  return 0;
}

// Size of the item whose header is `header` at `offset`, when it is a
// value or data item that lies wholly inside the storage. EINVAL for the
// end item and unknown item types, ERANGE for data running past the
// storage.
int itemSizeInStorage(const sb_packbuff* buffer, uint64_t offset, const ItemHeader& header,
                      uint64_t* size) {
  switch (header.type) {
    case SB_PACKBUFF_ITEM_UINT32:
      *size = ITEM_HEADER_SIZE;
      return 0;
    case SB_PACKBUFF_ITEM_STRING:
    case SB_PACKBUFF_ITEM_BYTES:
      *size = dataItemSize(header.value);
      return *size > buffer->bytes_allocated - offset ? ERANGE : 0;
    default:
      return EINVAL;
  }
}

// Moves the read cursor past an item of `size` bytes at `offset`. The item
// after it must start inside the storage (there is at least its end item).
int advanceCursor(sb_packbuff* buffer, uint64_t offset, uint64_t size) {
  const uint64_t bytes_to_advance = size;
  if (bytes_to_advance >= buffer->bytes_allocated - offset) return ERANGE;
  SB_PACKBUFF_CHECK((bytes_to_advance % BYTE_ALIGNMENT) == 0);
  buffer->item += bytes_to_advance;
  return 0;
}

int growBuffer(sb_packbuff* buffer, uint64_t bytes_needed) {
  if (buffer->block_size == 0 || buffer->dealloc_type != SB_PACKBUFF_DEALLOC_FREE) return ENOTSUP;

  uint64_t allocated = buffer->bytes_allocated + buffer->block_size;
  if (allocated < buffer->bytes_allocated) return ENOMEM;
  const uint64_t rounded = (bytes_needed + (BYTE_ALIGNMENT - 1)) & ~(BYTE_ALIGNMENT - 1);
  if (rounded < bytes_needed) return ENOMEM;
  const uint64_t room = allocated > buffer->bytes_used ? allocated - buffer->bytes_used : 0;
  if (rounded > room) {
    if (allocated + rounded < allocated) return ENOMEM;
    allocated += rounded;
  }

  void* storage = std::realloc(buffer->item_buffer, static_cast<size_t>(allocated));
  if (storage == nullptr) {
    // The old storage goes too: the buffer is left empty and can no
    // longer grow, so packing into it fails with ENOTSUP and freeing it
    // frees nothing twice.
    std::free(buffer->item_buffer);
    buffer->item_buffer = nullptr;
    buffer->item = nullptr;
    buffer->block_size = 0;
    buffer->bytes_allocated = 0;
    buffer->bytes_used = 0;
    buffer->bytes_remaining = 0;
    return ENOMEM;
  }
  buffer->item_buffer = static_cast<uint8_t*>(storage);
  buffer->bytes_allocated = allocated;
  buffer->bytes_remaining = allocated - buffer->bytes_used;
  buffer->item =
      buffer->item_buffer +
      (buffer->bytes_used >= ITEM_HEADER_SIZE ? buffer->bytes_used - ITEM_HEADER_SIZE : 0);
  return 0;
}

bool isGrowable(const sb_packbuff* buffer) {
  return buffer->block_size != 0 && buffer->dealloc_type == SB_PACKBUFF_DEALLOC_FREE;
}

// Appends one item at the write cursor (the end item) and a new end item
// after it. Nothing is written unless all of it fits.
int sb_packbuff_pack_item(sb_packbuff* buffer, uint16_t item_type, uint16_t value_type,
                          uint32_t inline_value, const void* additional_bytes, uint32_t length) {
  uint64_t space = ITEM_HEADER_SIZE;
  switch (item_type) {
    case SB_PACKBUFF_ITEM_UINT32: {
      const uint32_t extra_bytes_needed = length;
      SB_PACKBUFF_CHECK(extra_bytes_needed == 0);
      break;
    }
    case SB_PACKBUFF_ITEM_STRING:
    case SB_PACKBUFF_ITEM_BYTES:
      if (int error = packedDataItemSpace(length, &space)) return error;
      SB_PACKBUFF_CHECK(additional_bytes != NULL);
      break;
    default:
      return EINVAL;
  }

  if (buffer->bytes_remaining < space) {
    if (int error = growBuffer(buffer, space)) return error;
  }
  // The item and the end item after it must lie inside the storage. They
  // do whenever the cursor rests on the end item at bytes_used - 8; this
  // guards a buffer whose size was set under a read cursor.
  uint64_t offset;
  if (!cursorOffset(buffer, &offset) || space + ITEM_HEADER_SIZE > buffer->bytes_allocated - offset)
    return ERANGE;

  uint8_t* at = buffer->item;
  if (item_type == SB_PACKBUFF_ITEM_UINT32) {
    writeHeader(at, item_type, value_type, inline_value);
  } else {
    writeHeader(at, item_type, value_type, length);
    uint8_t* data = at + ITEM_HEADER_SIZE;
    // The padding is zeroed as the item's last 8 bytes, one store, before
    // the data is copied over the part of them that is data.
    if (length % BYTE_ALIGNMENT != 0)
      std::memset(data + length + padBytes(length) - BYTE_ALIGNMENT, 0, BYTE_ALIGNMENT);
    std::memcpy(data, additional_bytes, length);
  }
  buffer->bytes_remaining -= space;
  buffer->bytes_used += space;
  buffer->item += space;
  writeEndItem(buffer->item);
  return 0;
}

// Reads the item under the cursor, which must be of `item_type`, and moves
// past it. On ERANGE from the move, the value or data is still reported
// and the cursor stays. A string must end in its NUL (EINVAL otherwise,
// the cursor staying).
int sb_packbuff_unpack_item(sb_packbuff* buffer, uint16_t item_type, uint32_t* inline_value,
                            const uint8_t** data, uint32_t* length) {
  uint64_t offset;
  ItemHeader header;
  if (int error = headerAtCursor(buffer, &offset, &header)) return error;
  uint64_t size;
  const int size_error = itemSizeInStorage(buffer, offset, header, &size);
  if (size_error == ERANGE) return ERANGE;
  if (header.type != item_type || size_error != 0) return EINVAL;

  if (item_type == SB_PACKBUFF_ITEM_UINT32) {
    *inline_value = header.value;
  } else {
    const uint8_t* bytes = buffer->item + ITEM_HEADER_SIZE;
    if (item_type == SB_PACKBUFF_ITEM_STRING &&
        (header.value == 0 || bytes[header.value - 1] != '\0'))
      return EINVAL;
    *data = bytes;
    *length = header.value;
  }
  return advanceCursor(buffer, offset, size);
}

sb_packbuff* newBuffer(size_t block_size) {
  auto* buffer = static_cast<sb_packbuff*>(std::calloc(1, sizeof(sb_packbuff)));
  if (buffer == nullptr) return nullptr;
  buffer->block_size = block_size < BYTE_ALIGNMENT ? SB_PACKBUFF_DEFAULT_BLOCK_SIZE : block_size;
  buffer->dealloc_type = SB_PACKBUFF_DEALLOC_FREE;
  if (growBuffer(buffer, 0) != 0) {
    sb_packbuff_free(buffer);
    return nullptr;
  }
  buffer->bytes_used = ITEM_HEADER_SIZE;
  buffer->bytes_remaining -= ITEM_HEADER_SIZE;
  writeEndItem(buffer->item_buffer);
  buffer->item = buffer->item_buffer;
  return buffer;
}

sb_packbuff* bufferOverStorage(void* storage, size_t size, bool holds_items,
                               uint32_t dealloc_type) {
  if (storage == nullptr || (!holds_items && size < ITEM_HEADER_SIZE)) return nullptr;
  auto* buffer = static_cast<sb_packbuff*>(std::calloc(1, sizeof(sb_packbuff)));
  if (buffer == nullptr) return nullptr;
  buffer->dealloc_type = dealloc_type;
  buffer->block_size = 0;
  buffer->bytes_allocated = size;
  buffer->item_buffer = static_cast<uint8_t*>(storage);
  buffer->item = buffer->item_buffer;
  if (!holds_items) {
    writeEndItem(buffer->item_buffer);
    buffer->bytes_used = ITEM_HEADER_SIZE;
  } else {
    buffer->bytes_used = size;
  }
  buffer->bytes_remaining = buffer->bytes_allocated - buffer->bytes_used;
  return buffer;
}

const char* deallocTypeName(uint32_t dealloc_type) {
  switch (dealloc_type) {
    case SB_PACKBUFF_DEALLOC_NONE:
      return "None";
    case SB_PACKBUFF_DEALLOC_FREE:
      return "free()";
    case SB_PACKBUFF_DEALLOC_VM:
      return "vm_deallocate()";
    default:
      return "<Unknown>";
  }
}

}  // namespace

sb_packbuff* sb_packbuff_new(size_t block_size) { return newBuffer(block_size); }

sb_packbuff* sb_packbuff_new_with_tag(size_t block_size, const char* /*tag*/) {
  return newBuffer(block_size);
}

sb_packbuff* sb_packbuff_init_with_buffer(void* storage, size_t size, bool holds_items,
                                          uint32_t dealloc_type) {
  return bufferOverStorage(storage, size, holds_items, dealloc_type);
}

sb_packbuff* sb_packbuff_init_with_buffer_and_tag(void* storage, size_t size, bool holds_items,
                                                  uint32_t dealloc_type, const char* /*tag*/) {
  return bufferOverStorage(storage, size, holds_items, dealloc_type);
}

void sb_packbuff_free(sb_packbuff* buffer) {
  if (buffer == nullptr) return;
  switch (buffer->dealloc_type) {
    case SB_PACKBUFF_DEALLOC_FREE:
      std::free(buffer->item_buffer);
      break;
    case SB_PACKBUFF_DEALLOC_VM:
      if (buffer->item_buffer != nullptr &&
          munmap(buffer->item_buffer, static_cast<size_t>(buffer->bytes_allocated)) != 0) {
        const int error = errno;
        std::fprintf(stderr, "packbuff: munmap(%p, %zu) failed: %s\n",
                     static_cast<void*>(buffer->item_buffer),
                     static_cast<size_t>(buffer->bytes_allocated), std::strerror(error));
      }
      break;
    default:  // caller storage, or a type this module does not know: left alone
      break;
  }
  std::free(buffer);
}

void* sb_packbuff_get_bytes(const sb_packbuff* buffer) { return buffer->item_buffer; }

size_t sb_packbuff_get_size(const sb_packbuff* buffer) {
  return static_cast<size_t>(buffer->bytes_used);
}

// A size beyond the storage is taken as the whole storage: bytes used never
// exceeds bytes allocated, so bytes remaining cannot wrap into room that
// is not there.
void sb_packbuff_set_size(sb_packbuff* buffer, size_t size) {
  buffer->bytes_used = size < buffer->bytes_allocated ? size : buffer->bytes_allocated;
  buffer->bytes_remaining = buffer->bytes_allocated - buffer->bytes_used;
}

int sb_packbuff_pack_uint32(sb_packbuff* buffer, uint16_t value_type, uint32_t value) {
  return sb_packbuff_pack_item(buffer, SB_PACKBUFF_ITEM_UINT32, value_type, value, nullptr, 0);
}

int sb_packbuff_pack_string(sb_packbuff* buffer, uint16_t value_type, const char* text,
                            size_t length) {
  if (length > 0xFFFFFFFEu) return EINVAL;
  SB_PACKBUFF_CHECK(text != NULL);
  if (text[length] != '\0') return EINVAL;
  return sb_packbuff_pack_item(buffer, SB_PACKBUFF_ITEM_STRING, value_type, 0, text,
                               static_cast<uint32_t>(length + 1));
}

int sb_packbuff_pack_bytes(sb_packbuff* buffer, uint16_t value_type, const void* data,
                           size_t length) {
  if (length > 0xFFFFFFFFu) return EINVAL;
  return sb_packbuff_pack_item(buffer, SB_PACKBUFF_ITEM_BYTES, value_type, 0, data,
                               static_cast<uint32_t>(length));
}

// Both strings are checked, and on caller storage their room, before the
// key is written, so that a pair is packed whole or not at all (short of
// running out of memory, which empties the buffer anyway).
int sb_packbuff_pack_key_with_string_value(sb_packbuff* buffer, uint16_t key_value_type,
                                           const char* key, uint16_t value_value_type,
                                           const char* value) {
  SB_PACKBUFF_CHECK(key != NULL);
  SB_PACKBUFF_CHECK(value != NULL);
  const size_t key_length = std::strlen(key);
  const size_t value_length = std::strlen(value);
  uint64_t key_space, value_space;
  if (key_length > 0xFFFFFFFEu) return EINVAL;
  if (int error = packedDataItemSpace(static_cast<uint32_t>(key_length + 1), &key_space))
    return error;
  if (value_length > 0xFFFFFFFEu) return EINVAL;
  if (int error = packedDataItemSpace(static_cast<uint32_t>(value_length + 1), &value_space))
    return error;
  if (!isGrowable(buffer) && buffer->bytes_remaining < key_space + value_space) return ENOTSUP;

  if (int error = sb_packbuff_pack_string(buffer, key_value_type, key, key_length)) return error;
  return sb_packbuff_pack_string(buffer, value_value_type, value, value_length);
}

bool sb_packbuff_get_item_value_type(const sb_packbuff* buffer, uint16_t* value_type) {
  uint64_t offset;
  ItemHeader header;
  if (headerAtCursor(buffer, &offset, &header) != 0) return false;
  if (header.type == SB_PACKBUFF_ITEM_END) return false;
  *value_type = header.value_type;
  return true;
}

uint32_t sb_packbuff_unpack_uint32(sb_packbuff* buffer, int* error) {
  uint32_t value = 0;
  const int result =
      sb_packbuff_unpack_item(buffer, SB_PACKBUFF_ITEM_UINT32, &value, nullptr, nullptr);
  if (error != nullptr) *error = result;
  return value;
}

const char* sb_packbuff_unpack_string(sb_packbuff* buffer, size_t* length, int* error) {
  const uint8_t* data = nullptr;
  uint32_t data_length = 0;
  const int result =
      sb_packbuff_unpack_item(buffer, SB_PACKBUFF_ITEM_STRING, nullptr, &data, &data_length);
  if (error != nullptr) *error = result;
  if (result != 0) {
    if (length != nullptr) *length = 0;
    return nullptr;
  }
  if (length != nullptr) *length = data_length - 1;
  return reinterpret_cast<const char*>(data);
}

const void* sb_packbuff_unpack_bytes(sb_packbuff* buffer, size_t* length, int* error) {
  const uint8_t* data = nullptr;
  uint32_t data_length = 0;
  const int result =
      sb_packbuff_unpack_item(buffer, SB_PACKBUFF_ITEM_BYTES, nullptr, &data, &data_length);
  if (error != nullptr) *error = result;
  if (result != 0) {
    if (length != nullptr) *length = 0;
    return nullptr;
  }
  if (length != nullptr) *length = data_length;
  return data;
}

// The outputs are set only when both strings were read. A failure after
// the key leaves the cursor past the key.
int sb_packbuff_unpack_key_with_string_value(sb_packbuff* buffer, const char** key,
                                             uint16_t* value_type, const char** value,
                                             size_t* value_length) {
  int error = 0;
  const char* key_text = sb_packbuff_unpack_string(buffer, nullptr, &error);
  if (error != 0) return error;
  uint16_t type = 0;
  (void)sb_packbuff_get_item_value_type(buffer, &type);  // unpacking reports a missing item
  size_t length = 0;
  const char* value_text = sb_packbuff_unpack_string(buffer, &length, &error);
  if (error != 0) return error;
  if (key != nullptr) *key = key_text;
  if (value_type != nullptr) *value_type = type;
  if (value != nullptr) *value = value_text;
  if (value_length != nullptr) *value_length = length;
  return 0;
}

int sb_packbuff_skip_item(sb_packbuff* buffer) {
  uint64_t offset;
  ItemHeader header;
  if (int error = headerAtCursor(buffer, &offset, &header)) return error;
  uint64_t size;
  if (int error = itemSizeInStorage(buffer, offset, header, &size)) return error;
  return advanceCursor(buffer, offset, size);
}

void sb_packbuff_print(const sb_packbuff* buffer) { sb_packbuff_print_to(buffer, stdout); }

// The walk reads only what lies inside both the bytes used and the storage,
// so it is safe on a buffer received from a peer.
void sb_packbuff_print_to(const sb_packbuff* buffer, FILE* out) {
  std::fprintf(out, "packbuff: %p\n", static_cast<const void*>(buffer));
  if (buffer == nullptr) return;
  std::fprintf(out, "  block_size:      %zu\n", static_cast<size_t>(buffer->block_size));
  std::fprintf(out, "  dealloc_type:    %s\n", deallocTypeName(buffer->dealloc_type));
  std::fprintf(out, "  bytes_allocated: %zu\n", static_cast<size_t>(buffer->bytes_allocated));
  std::fprintf(out, "  bytes_used:      %zu\n", static_cast<size_t>(buffer->bytes_used));
  std::fprintf(out, "  bytes_remaining: %zu\n", static_cast<size_t>(buffer->bytes_remaining));
  std::fprintf(out, "  item_buffer %p, item: %p\n", static_cast<const void*>(buffer->item_buffer),
               static_cast<const void*>(buffer->item));

  const uint8_t* storage = buffer->item_buffer;
  const uint64_t limit =
      buffer->bytes_used < buffer->bytes_allocated ? buffer->bytes_used : buffer->bytes_allocated;
  uint64_t offset = 0;
  for (int index = 0;; ++index) {
    if (storage == nullptr || limit < ITEM_HEADER_SIZE || offset > limit - ITEM_HEADER_SIZE) {
      std::fprintf(out, ">> item pointer exceeds end of buffer. <<\n");
      return;
    }
    const uint8_t* at = storage + offset;
    const char* prefix = at == buffer->item ? ">> " : "   ";
    const ItemHeader header = readHeader(at);
    if (header.type == SB_PACKBUFF_ITEM_END) {
      std::fprintf(out, "%s%3d: %p -- END\n", prefix, index, static_cast<const void*>(at));
      return;
    }
    std::fprintf(out, "%s%3d:%p -- value type %u --", prefix, index, static_cast<const void*>(at),
                 static_cast<unsigned>(header.value_type));
    uint32_t data_length = 0;
    switch (header.type) {
      case SB_PACKBUFF_ITEM_UINT32:
        std::fprintf(out, " inline value: %u\n", header.value);
        break;
      case SB_PACKBUFF_ITEM_STRING: {
        data_length = header.value;
        // Only what lies inside the walk's limit is printed, up to the
        // first NUL.
        const uint64_t there = limit - offset - ITEM_HEADER_SIZE;
        const uint64_t shown = data_length < there ? data_length : there;
        std::fprintf(out, " string (%p, %u pad bytes, size: %u): \n     `%.*s'\n",
                     static_cast<const void*>(at + ITEM_HEADER_SIZE), padBytes(data_length),
                     data_length, static_cast<int>(shown < INT_MAX ? shown : INT_MAX),
                     reinterpret_cast<const char*>(at + ITEM_HEADER_SIZE));
        break;
      }
      case SB_PACKBUFF_ITEM_BYTES:
        data_length = header.value;
        std::fprintf(out, " bytes (%p, %u pad bytes, size: %u)\n",
                     static_cast<const void*>(at + ITEM_HEADER_SIZE), padBytes(data_length),
                     data_length);
        break;
      default:
        std::fprintf(out, " *Unknown item type* %u\n", static_cast<unsigned>(header.type));
        return;
    }
    // The item's size as the wire's 32-bit arithmetic computes it.
    const uint32_t padded = data_length + padBytes(data_length);
    const uint32_t size = padded + static_cast<uint32_t>(ITEM_HEADER_SIZE);
    if (padded < data_length || size < padded ||
        reinterpret_cast<uintptr_t>(at) + size < reinterpret_cast<uintptr_t>(at)) {
      std::fprintf(out, ">> item pointer overflow. <<\n");
      return;
    }
    offset += size;
  }
}
