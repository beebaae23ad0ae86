#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <bit>
#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "upcall/VSAPackBuffer.h"

// The literal byte patterns below are written for the little-endian hosts
// the daemon runs on; the wire format is host byte order.
static_assert(std::endian::native == std::endian::little);

// The sanitizers' allocators abort on allocations as large as the failed
// reallocation test asks for, rather than failing them.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define PACKBUFF_TEST_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define PACKBUFF_TEST_ASAN 1
#endif
#endif

namespace {

using Bytes = std::vector<uint8_t>;

struct BufferDeleter {
  void operator()(sb_packbuff* b) const { sb_packbuff_free(b); }
};
using BufferPtr = std::unique_ptr<sb_packbuff, BufferDeleter>;

Bytes bytesOf(const sb_packbuff* b) {
  const auto* p = static_cast<const uint8_t*>(sb_packbuff_get_bytes(b));
  return Bytes(p, p + sb_packbuff_get_size(b));
}

// One item as the wire has it: header, data, then `pad` zero bytes.
Bytes item(uint16_t type, uint16_t valueType, uint32_t value, const std::string& data = "",
           size_t pad = 0) {
  Bytes out(8 + data.size() + pad, 0);
  std::memcpy(out.data(), &type, 2);
  std::memcpy(out.data() + 2, &valueType, 2);
  std::memcpy(out.data() + 4, &value, 4);
  if (!data.empty()) std::memcpy(out.data() + 8, data.data(), data.size());
  return out;
}

Bytes endItem() { return Bytes(8, 0); }

Bytes concat(std::initializer_list<Bytes> parts) {
  Bytes out;
  for (const Bytes& p : parts) out.insert(out.end(), p.begin(), p.end());
  return out;
}

// A heap block of exactly the given bytes, so that the address sanitizer
// reports any read past its end.
class HeapBlock {
 public:
  explicit HeapBlock(const Bytes& bytes)
      : size_(bytes.size()), data_(static_cast<uint8_t*>(std::malloc(bytes.empty() ? 1 : size_))) {
    if (!bytes.empty()) std::memcpy(data_, bytes.data(), size_);
  }
  ~HeapBlock() { std::free(data_); }
  HeapBlock(const HeapBlock&) = delete;
  HeapBlock& operator=(const HeapBlock&) = delete;
  uint8_t* data() const { return data_; }
  size_t size() const { return size_; }

 private:
  size_t size_;
  uint8_t* data_;
};

BufferPtr reader(const HeapBlock& block) {
  return BufferPtr(
      sb_packbuff_init_with_buffer(block.data(), block.size(), true, SB_PACKBUFF_DEALLOC_NONE));
}

ptrdiff_t cursor(const sb_packbuff* b) { return b->item - b->item_buffer; }

// The writer's invariants after any successful pack: the cursor rests on
// an end item at bytes_used - 8 and the counters agree.
void expectWriterConsistent(const sb_packbuff* b) {
  ASSERT_GE(b->bytes_used, 8u);
  ASSERT_LE(b->bytes_used, b->bytes_allocated);
  EXPECT_EQ(b->bytes_remaining, b->bytes_allocated - b->bytes_used);
  EXPECT_EQ(cursor(b), static_cast<ptrdiff_t>(b->bytes_used - 8));
  EXPECT_EQ(Bytes(b->item, b->item + 8), endItem());
}

std::string printed(const sb_packbuff* b) {
  char* text = nullptr;
  size_t length = 0;
  FILE* out = open_memstream(&text, &length);
  sb_packbuff_print_to(b, out);
  std::fclose(out);
  std::string s(text, length);
  std::free(text);
  return s;
}

std::string format(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
std::string format(const char* fmt, ...) {
  char line[512];
  va_list args;
  va_start(args, fmt);
  std::vsnprintf(line, sizeof line, fmt, args);
  va_end(args);
  return line;
}

std::string printedHeader(const sb_packbuff* b, const char* dealloc) {
  return format("packbuff: %p\n", static_cast<const void*>(b)) +
         format("  block_size:      %zu\n", static_cast<size_t>(b->block_size)) +
         format("  dealloc_type:    %s\n", dealloc) +
         format("  bytes_allocated: %zu\n", static_cast<size_t>(b->bytes_allocated)) +
         format("  bytes_used:      %zu\n", static_cast<size_t>(b->bytes_used)) +
         format("  bytes_remaining: %zu\n", static_cast<size_t>(b->bytes_remaining)) +
         format("  item_buffer %p, item: %p\n", static_cast<const void*>(b->item_buffer),
                static_cast<const void*>(b->item));
}

const std::string kPath =
    "/private/var/mobile/Containers/Data/Application/0A1B2C3D-0000-4000-8000-00000000F00D";

// ---------------------------------------------------------------------------
// Creation

TEST(VSAPackBuffer, FreshBufferHoldsOnlyTheEndItem) {
  BufferPtr b(sb_packbuff_new(0));
  ASSERT_TRUE(b);
  EXPECT_EQ(sb_packbuff_get_size(b.get()), 8u);
  EXPECT_EQ(bytesOf(b.get()), endItem());
  EXPECT_EQ(b->block_size, 256u);
  EXPECT_EQ(b->dealloc_type, SB_PACKBUFF_DEALLOC_FREE);
  EXPECT_EQ(b->bytes_allocated, 256u);
  EXPECT_EQ(b->bytes_remaining, 248u);
  EXPECT_EQ(b->item, b->item_buffer);
  uint16_t valueType = 0xABCD;
  EXPECT_FALSE(sb_packbuff_get_item_value_type(b.get(), &valueType));
  EXPECT_EQ(valueType, 0xABCD);
}

TEST(VSAPackBuffer, BlockSizeBelowEightMeansTheDefault) {
  for (size_t asked : {size_t(0), size_t(1), size_t(7)}) {
    BufferPtr b(sb_packbuff_new_with_tag(asked, "test"));
    ASSERT_TRUE(b);
    EXPECT_EQ(b->block_size, 256u) << asked;
    EXPECT_EQ(b->bytes_allocated, 256u) << asked;
  }
  BufferPtr eight(sb_packbuff_new(8));
  ASSERT_TRUE(eight);
  EXPECT_EQ(eight->block_size, 8u);
  EXPECT_EQ(eight->bytes_allocated, 8u);
  EXPECT_EQ(eight->bytes_remaining, 0u);
  EXPECT_EQ(bytesOf(eight.get()), endItem());
}

TEST(VSAPackBuffer, InitOverCallerStorage) {
  uint8_t storage[32];
  std::memset(storage, 0xAA, sizeof storage);
  BufferPtr w(sb_packbuff_init_with_buffer_and_tag(storage, sizeof storage, false,
                                                   SB_PACKBUFF_DEALLOC_NONE, "test"));
  ASSERT_TRUE(w);
  EXPECT_EQ(w->block_size, 0u);
  EXPECT_EQ(w->bytes_allocated, 32u);
  EXPECT_EQ(w->bytes_used, 8u);
  EXPECT_EQ(w->bytes_remaining, 24u);
  EXPECT_EQ(w->item, storage);
  EXPECT_EQ(Bytes(storage, storage + 8), endItem());
  EXPECT_EQ(storage[8], 0xAA);  // only the end item is written

  std::memset(storage, 0xAA, sizeof storage);
  BufferPtr r(sb_packbuff_init_with_buffer(storage, 20, true, SB_PACKBUFF_DEALLOC_NONE));
  ASSERT_TRUE(r);
  EXPECT_EQ(r->bytes_used, 20u);
  EXPECT_EQ(r->bytes_remaining, 0u);
  EXPECT_EQ(r->item, storage);
  EXPECT_EQ(storage[0], 0xAA);  // the items are left as they are

  EXPECT_EQ(sb_packbuff_init_with_buffer(nullptr, 64, false, SB_PACKBUFF_DEALLOC_NONE), nullptr);
  EXPECT_EQ(sb_packbuff_init_with_buffer(nullptr, 64, true, SB_PACKBUFF_DEALLOC_NONE), nullptr);
  EXPECT_EQ(sb_packbuff_init_with_buffer(storage, 7, false, SB_PACKBUFF_DEALLOC_NONE), nullptr);
  BufferPtr small(sb_packbuff_init_with_buffer(storage, 7, true, SB_PACKBUFF_DEALLOC_NONE));
  ASSERT_TRUE(small);
  EXPECT_EQ(small->bytes_used, 7u);
}

TEST(VSAPackBuffer, SetSizeRecomputesRemainingAndStaysInsideTheStorage) {
  uint8_t storage[64] = {};
  BufferPtr b(
      sb_packbuff_init_with_buffer(storage, sizeof storage, false, SB_PACKBUFF_DEALLOC_NONE));
  sb_packbuff_set_size(b.get(), 40);
  EXPECT_EQ(sb_packbuff_get_size(b.get()), 40u);
  EXPECT_EQ(b->bytes_remaining, 24u);
  sb_packbuff_set_size(b.get(), 1000);
  EXPECT_EQ(sb_packbuff_get_size(b.get()), 64u);
  EXPECT_EQ(b->bytes_remaining, 0u);
  EXPECT_EQ(sb_packbuff_get_bytes(b.get()), storage);
}

// ---------------------------------------------------------------------------
// Packing: exact bytes

TEST(VSAPackBuffer, PackedItemsHaveTheirExactBytes) {
  BufferPtr b(sb_packbuff_new(0));
  ASSERT_EQ(sb_packbuff_pack_string(b.get(), 7, "ab", 2), 0);
  const Bytes ab = {2, 0, 7, 0, 3, 0, 0, 0, 'a', 'b', 0, 0, 0, 0, 0, 0};
  EXPECT_EQ(bytesOf(b.get()), concat({ab, endItem()}));
  EXPECT_EQ(b->bytes_used, 24u);
  EXPECT_EQ(b->bytes_remaining, 232u);
  EXPECT_EQ(cursor(b.get()), 16);

  const uint8_t eight[8] = {1, 2, 3, 4, 5, 6, 7, 8};
  ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 9, eight, sizeof eight), 0);
  const Bytes bytes8 = {3, 0, 9, 0, 8, 0, 0, 0, 1, 2, 3, 4, 5, 6, 7, 8};
  EXPECT_EQ(bytesOf(b.get()), concat({ab, bytes8, endItem()}));

  ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 0x0102, 0xA1B2C3D4), 0);
  const Bytes inlineItem = {1, 0, 0x02, 0x01, 0xD4, 0xC3, 0xB2, 0xA1};
  EXPECT_EQ(bytesOf(b.get()), concat({ab, bytes8, inlineItem, endItem()}));

  ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 4, eight, 0), 0);
  EXPECT_EQ(bytesOf(b.get()), concat({ab, bytes8, inlineItem, item(3, 4, 0), endItem()}));
  expectWriterConsistent(b.get());
}

TEST(VSAPackBuffer, PaddingIsZeroedOverEarlierStorageBytes) {
  const std::string data = "0123456789abcdef";
  for (size_t length = 0; length <= 16; ++length) {
    uint8_t storage[48];
    std::memset(storage, 0xEE, sizeof storage);
    BufferPtr b(
        sb_packbuff_init_with_buffer(storage, sizeof storage, false, SB_PACKBUFF_DEALLOC_NONE));
    ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 1, data.data(), length), 0) << length;
    const size_t pad = (8 - length % 8) % 8;
    EXPECT_EQ(
        bytesOf(b.get()),
        concat({item(3, 1, static_cast<uint32_t>(length), data.substr(0, length), pad), endItem()}))
        << length;
    EXPECT_EQ(b->bytes_used, 16 + length + pad) << length;
    // Nothing is written past the new end item.
    EXPECT_EQ(storage[b->bytes_used], 0xEE) << length;
  }
}

TEST(VSAPackBuffer, StringsNeedTheirNulAtLength) {
  BufferPtr b(sb_packbuff_new(0));
  const char noNul[4] = {'a', 'b', 'c', 'd'};
  EXPECT_EQ(sb_packbuff_pack_string(b.get(), 1, noNul, 3), EINVAL);
  EXPECT_EQ(sb_packbuff_pack_string(b.get(), 1, "abc", 2), EINVAL);
  EXPECT_EQ(bytesOf(b.get()), endItem());
  expectWriterConsistent(b.get());
  // An embedded NUL is part of the string when the byte at length is one.
  const char embedded[] = "a\0b";
  ASSERT_EQ(sb_packbuff_pack_string(b.get(), 1, embedded, 3), 0);
  EXPECT_EQ(bytesOf(b.get()), concat({item(2, 1, 4, std::string("a\0b\0", 4), 4), endItem()}));
  ASSERT_EQ(sb_packbuff_pack_string(b.get(), 2, "", 0), 0);
  EXPECT_EQ(bytesOf(b.get()), concat({item(2, 1, 4, std::string("a\0b\0", 4), 4),
                                      item(2, 2, 1, std::string(1, '\0'), 7), endItem()}));
}

TEST(VSAPackBuffer, KeyWithStringValueIsTwoStringItems) {
  BufferPtr b(sb_packbuff_new(0));
  ASSERT_EQ(sb_packbuff_pack_key_with_string_value(b.get(), 10, "key", 11, "value-x"), 0);
  EXPECT_EQ(bytesOf(b.get()), concat({item(2, 10, 4, std::string("key\0", 4), 4),
                                      item(2, 11, 8, std::string("value-x\0", 8), 0), endItem()}));
  expectWriterConsistent(b.get());
}

// ---------------------------------------------------------------------------
// Packing: failures leave the buffer as it was

TEST(VSAPackBuffer, FullCallerStorageRefusesEveryPackUnchanged) {
  uint8_t storage[8];
  std::memset(storage, 0xAA, sizeof storage);
  BufferPtr b(
      sb_packbuff_init_with_buffer(storage, sizeof storage, false, SB_PACKBUFF_DEALLOC_NONE));
  ASSERT_TRUE(b);
  const Bytes before(storage, storage + 8);
  ASSERT_EQ(before, endItem());
  const uint8_t one = 1;
  EXPECT_EQ(sb_packbuff_pack_uint32(b.get(), 1, 5), ENOTSUP);
  EXPECT_EQ(sb_packbuff_pack_string(b.get(), 1, "x", 1), ENOTSUP);
  EXPECT_EQ(sb_packbuff_pack_bytes(b.get(), 1, &one, 1), ENOTSUP);
  EXPECT_EQ(sb_packbuff_pack_bytes(b.get(), 1, &one, 0), ENOTSUP);
  EXPECT_EQ(sb_packbuff_pack_key_with_string_value(b.get(), 1, "k", 2, "v"), ENOTSUP);
  EXPECT_EQ(Bytes(storage, storage + 8), before);
  EXPECT_EQ(b->bytes_used, 8u);
  EXPECT_EQ(b->bytes_remaining, 0u);
  EXPECT_EQ(b->bytes_allocated, 8u);
  EXPECT_EQ(b->item, storage);
}

TEST(VSAPackBuffer, CallerStorageFillsToTheLastByte) {
  uint8_t storage[32];
  std::memset(storage, 0xAA, sizeof storage);
  BufferPtr b(
      sb_packbuff_init_with_buffer(storage, sizeof storage, false, SB_PACKBUFF_DEALLOC_NONE));
  // 18 bytes pad to 24: with its header 32, more than the 24 left.
  EXPECT_EQ(sb_packbuff_pack_string(b.get(), 1, "abcdefghijklmnopq", 17), ENOTSUP);
  Bytes expected = concat({endItem(), Bytes(24, 0xAA)});
  EXPECT_EQ(Bytes(storage, storage + 32), expected);
  ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 2, 3), 0);
  const uint8_t data[8] = {9, 9, 9, 9, 9, 9, 9, 9};
  ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 3, data, 8), 0);
  expected = concat({item(1, 2, 3), item(3, 3, 8, std::string(8, '\x09')), endItem()});
  EXPECT_EQ(Bytes(storage, storage + 32), expected);
  EXPECT_EQ(b->bytes_used, 32u);
  EXPECT_EQ(b->bytes_remaining, 0u);
  EXPECT_EQ(sb_packbuff_pack_uint32(b.get(), 4, 4), ENOTSUP);
  EXPECT_EQ(Bytes(storage, storage + 32), expected);
}

TEST(VSAPackBuffer, KeyValuePairIsPackedWholeOrNotAtAll) {
  uint8_t storage[40];
  std::memset(storage, 0xAA, sizeof storage);
  BufferPtr b(
      sb_packbuff_init_with_buffer(storage, sizeof storage, false, SB_PACKBUFF_DEALLOC_NONE));
  // The key (16 bytes) fits the 32 left, the value (32 bytes) after it not.
  const Bytes before(storage, storage + sizeof storage);
  EXPECT_EQ(sb_packbuff_pack_key_with_string_value(b.get(), 1, "k", 2, "value-too-long-x"),
            ENOTSUP);
  EXPECT_EQ(Bytes(storage, storage + sizeof storage), before);
  EXPECT_EQ(b->bytes_used, 8u);
  EXPECT_EQ(b->item, storage);
  ASSERT_EQ(sb_packbuff_pack_key_with_string_value(b.get(), 1, "k", 2, "value-a"), 0);
  EXPECT_EQ(Bytes(storage, storage + sizeof storage),
            concat({item(2, 1, 2, std::string("k\0", 2), 6),
                    item(2, 2, 8, std::string("value-a\0", 8)), endItem()}));
}

TEST(VSAPackBuffer, OnlyGrowableHeapBuffersGrow) {
  // Heap storage handed over with dealloc type free() has no block size.
  auto* heap = static_cast<uint8_t*>(std::malloc(8));
  BufferPtr freed(sb_packbuff_init_with_buffer(heap, 8, false, SB_PACKBUFF_DEALLOC_FREE));
  EXPECT_EQ(sb_packbuff_pack_uint32(freed.get(), 1, 1), ENOTSUP);
  EXPECT_EQ(bytesOf(freed.get()), endItem());

  // A block size does not make mapped storage growable.
  void* page = mmap(nullptr, 4096, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(page, MAP_FAILED);
  BufferPtr mapped(sb_packbuff_init_with_buffer(page, 8, false, SB_PACKBUFF_DEALLOC_VM));
  mapped->block_size = 256;
  EXPECT_EQ(sb_packbuff_pack_uint32(mapped.get(), 1, 1), ENOTSUP);
  EXPECT_EQ(mapped->bytes_allocated, 8u);
  mapped->bytes_allocated = 4096;  // so that free unmaps the whole page
}

TEST(VSAPackBuffer, PaddedLengthOverflowIsErange) {
  BufferPtr b(sb_packbuff_new(0));
  // Never read: every one of these fails before the data is touched.
  const void* fake = reinterpret_cast<const void*>(uintptr_t{0x10});
  for (size_t length :
       {size_t(0xFFFFFFF9), size_t(0xFFFFFFFF), size_t(0xFFFFFFF8), size_t(0xFFFFFFF1)})
    EXPECT_EQ(sb_packbuff_pack_bytes(b.get(), 1, fake, length), ERANGE) << length;
  EXPECT_EQ(sb_packbuff_pack_bytes(b.get(), 1, fake, size_t(0x100000000)), EINVAL);
  EXPECT_EQ(sb_packbuff_pack_string(b.get(), 1, static_cast<const char*>(fake), 0xFFFFFFFF),
            EINVAL);
  EXPECT_EQ(bytesOf(b.get()), endItem());
  expectWriterConsistent(b.get());
  EXPECT_EQ(b->bytes_allocated, 256u);
}

TEST(VSAPackBufferDeathTest, DataItemsNeedData) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  BufferPtr b(sb_packbuff_new(0));
  EXPECT_DEATH(sb_packbuff_pack_bytes(b.get(), 1, nullptr, 4), "additional_bytes != NULL");
  EXPECT_DEATH(sb_packbuff_pack_bytes(b.get(), 1, nullptr, 0), "additional_bytes != NULL");
}

TEST(VSAPackBuffer, PackingUnderAMovedReadCursorStaysInsideTheStorage) {
  HeapBlock block(concat({item(1, 1, 1), item(1, 1, 2), item(1, 1, 3), endItem()}));
  BufferPtr b = reader(block);
  ASSERT_EQ(sb_packbuff_skip_item(b.get()), 0);
  ASSERT_EQ(sb_packbuff_skip_item(b.get()), 0);
  sb_packbuff_set_size(b.get(), 8);  // 24 bytes "remain", but the cursor is at 16
  const Bytes before(block.data(), block.data() + block.size());
  const char data[16] = "0123456789abcde";
  EXPECT_EQ(sb_packbuff_pack_bytes(b.get(), 1, data, 16), ERANGE);
  EXPECT_EQ(Bytes(block.data(), block.data() + block.size()), before);
  EXPECT_EQ(b->bytes_used, 8u);
  EXPECT_EQ(cursor(b.get()), 16);
}

// ---------------------------------------------------------------------------
// Growth

TEST(VSAPackBuffer, GrowthAddsABlockAndWhatDoesNotFit) {
  BufferPtr b(sb_packbuff_new(8));
  ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 1, 7), 0);
  // 8 more for the block; the 8 needed fit what is left after it.
  EXPECT_EQ(b->bytes_allocated, 16u);
  EXPECT_EQ(b->bytes_used, 16u);
  EXPECT_EQ(b->bytes_remaining, 0u);
  expectWriterConsistent(b.get());
  ASSERT_EQ(sb_packbuff_pack_string(b.get(), 2, "ab", 2), 0);
  // 8 for the block leaves 8 room, less than the 16 needed: both added.
  EXPECT_EQ(b->bytes_allocated, 40u);
  EXPECT_EQ(b->bytes_used, 32u);
  EXPECT_EQ(b->bytes_remaining, 8u);
  expectWriterConsistent(b.get());
  ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 3, 9), 0);  // fits without growing
  EXPECT_EQ(b->bytes_allocated, 40u);
  EXPECT_EQ(bytesOf(b.get()), concat({item(1, 1, 7), item(2, 2, 3, std::string("ab\0", 3), 5),
                                      item(1, 3, 9), endItem()}));

  BufferPtr d(sb_packbuff_new(0));
  const std::string big(300, 'z');
  ASSERT_EQ(sb_packbuff_pack_bytes(d.get(), 1, big.data(), big.size()), 0);
  EXPECT_EQ(d->bytes_allocated, 512u);
  EXPECT_EQ(d->bytes_used, 320u);
  EXPECT_EQ(d->bytes_remaining, 192u);
  expectWriterConsistent(d.get());

  // A block size that is no multiple of 8 still keeps items aligned.
  BufferPtr odd(sb_packbuff_new(9));
  ASSERT_EQ(sb_packbuff_pack_uint32(odd.get(), 1, 1), 0);
  EXPECT_EQ(odd->bytes_allocated, 18u);
  EXPECT_EQ(odd->bytes_used, 16u);
  expectWriterConsistent(odd.get());
}

TEST(VSAPackBuffer, GrowthAcrossManyBlocksKeepsEarlierItems) {
  for (size_t blockSize : {size_t(8), size_t(0), size_t(24)}) {
    BufferPtr b(sb_packbuff_new(blockSize));
    Bytes expected;
    for (uint32_t i = 0; i < 400; ++i) {
      const std::string s = kPath.substr(0, i % 90);
      switch (i % 3) {
        case 0:
          ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), uint16_t(i), i * 2654435761u), 0);
          expected = concat({expected, item(1, uint16_t(i), i * 2654435761u)});
          break;
        case 1:
          ASSERT_EQ(sb_packbuff_pack_string(b.get(), uint16_t(i), s.c_str(), s.size()), 0);
          expected =
              concat({expected, item(2, uint16_t(i), uint32_t(s.size() + 1),
                                     s + std::string(1, '\0'), (8 - (s.size() + 1) % 8) % 8)});
          break;
        default:
          ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), uint16_t(i), s.data(), s.size()), 0);
          expected = concat(
              {expected, item(3, uint16_t(i), uint32_t(s.size()), s, (8 - s.size() % 8) % 8)});
      }
      expectWriterConsistent(b.get());
    }
    EXPECT_EQ(bytesOf(b.get()), concat({expected, endItem()})) << blockSize;
  }
}

TEST(VSAPackBuffer, GrowthSizeOverflowIsEnomemAndKeepsTheBuffer) {
  BufferPtr b(sb_packbuff_new(16));
  ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 1, 1), 0);
  b->block_size = UINT64_MAX;  // the next block would wrap the allocation size
  const Bytes before = bytesOf(b.get());
  const uint64_t allocated = b->bytes_allocated;
  EXPECT_EQ(sb_packbuff_pack_bytes(b.get(), 1, kPath.data(), kPath.size()), ENOMEM);
  EXPECT_EQ(bytesOf(b.get()), before);
  EXPECT_EQ(b->bytes_allocated, allocated);
  expectWriterConsistent(b.get());
}

TEST(VSAPackBuffer, FailedReallocationEmptiesTheBuffer) {
#ifdef PACKBUFF_TEST_ASAN
  GTEST_SKIP() << "the sanitizer's allocator aborts on allocations this large";
#else
  EXPECT_EQ(sb_packbuff_new(size_t(1) << 62), nullptr);

  BufferPtr b(sb_packbuff_new(16));
  ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 1, 1), 0);
  b->block_size = uint64_t(1) << 62;
  EXPECT_EQ(sb_packbuff_pack_bytes(b.get(), 1, kPath.data(), kPath.size()), ENOMEM);
  EXPECT_EQ(b->item_buffer, nullptr);
  EXPECT_EQ(b->item, nullptr);
  EXPECT_EQ(b->bytes_allocated, 0u);
  EXPECT_EQ(b->bytes_used, 0u);
  EXPECT_EQ(b->bytes_remaining, 0u);
  // Emptied for good: no packing, no reading, and freeing frees nothing twice.
  EXPECT_EQ(sb_packbuff_pack_uint32(b.get(), 1, 1), ENOTSUP);
  int error = 0;
  EXPECT_EQ(sb_packbuff_unpack_uint32(b.get(), &error), 0u);
  EXPECT_EQ(error, ERANGE);
  EXPECT_EQ(sb_packbuff_skip_item(b.get()), ERANGE);
#endif
}

// ---------------------------------------------------------------------------
// Reading

TEST(VSAPackBuffer, WrongItemTypeIsEinvalAndTheCursorStays) {
  HeapBlock block(
      concat({item(1, 5, 0xDEADBEEF), item(2, 6, 2, std::string("x\0", 2), 6), endItem()}));
  BufferPtr r = reader(block);
  int error = 0;
  size_t length = 99;
  EXPECT_EQ(sb_packbuff_unpack_string(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(length, 0u);
  EXPECT_EQ(cursor(r.get()), 0);
  EXPECT_EQ(sb_packbuff_unpack_bytes(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(cursor(r.get()), 0);
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 0xDEADBEEFu);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(cursor(r.get()), 8);
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 0u);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(cursor(r.get()), 8);
  const char* text = sb_packbuff_unpack_string(r.get(), &length, &error);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(text, reinterpret_cast<const char*>(block.data() + 16));
  EXPECT_EQ(length, 1u);
  EXPECT_STREQ(text, "x");
  EXPECT_EQ(cursor(r.get()), 24);
}

TEST(VSAPackBuffer, MixedBufferRoundTrip) {
  BufferPtr w(sb_packbuff_new(0));
  const uint8_t bin[5] = {0, 0xFF, 0x7F, 0x80, 1};
  ASSERT_EQ(sb_packbuff_pack_uint32(w.get(), 1, 42), 0);
  ASSERT_EQ(sb_packbuff_pack_string(w.get(), 2, kPath.c_str(), kPath.size()), 0);
  ASSERT_EQ(sb_packbuff_pack_bytes(w.get(), 3, bin, sizeof bin), 0);
  ASSERT_EQ(sb_packbuff_pack_bytes(w.get(), 4, bin, 0), 0);
  ASSERT_EQ(sb_packbuff_pack_key_with_string_value(w.get(), 10, "key", 11, "value"), 0);
  ASSERT_EQ(sb_packbuff_pack_string(w.get(), 5, "", 0), 0);
  ASSERT_EQ(sb_packbuff_pack_key_with_string_value(w.get(), 12, "", 13, kPath.c_str()), 0);
  ASSERT_EQ(sb_packbuff_pack_uint32(w.get(), 6, 0xFFFFFFFF), 0);

  HeapBlock block(bytesOf(w.get()));
  // 8 + (8+88) + (8+8) + 8 + (8+8)+(8+8) + (8+8) + (8+8)+(8+88) + 8 + end
  ASSERT_EQ(block.size(), 304u);
  BufferPtr r = reader(block);
  const uint8_t* base = block.data();
  int error = -1;
  uint16_t type = 0;
  size_t length = 0;

  ASSERT_TRUE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(type, 1);
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 42u);
  EXPECT_EQ(error, 0);

  ASSERT_TRUE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(type, 2);
  const char* path = sb_packbuff_unpack_string(r.get(), &length, &error);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(path, reinterpret_cast<const char*>(base + 16));
  EXPECT_EQ(std::string(path, length), kPath);
  EXPECT_EQ(cursor(r.get()), 8 + 8 + 88);

  ASSERT_TRUE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(type, 3);
  const void* data = sb_packbuff_unpack_bytes(r.get(), &length, &error);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(data, base + 112);
  ASSERT_EQ(length, sizeof bin);
  EXPECT_EQ(std::memcmp(data, bin, sizeof bin), 0);

  ASSERT_TRUE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(type, 4);
  data = sb_packbuff_unpack_bytes(r.get(), &length, &error);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(length, 0u);
  EXPECT_EQ(data, base + 128);
  EXPECT_EQ(cursor(r.get()), 128);

  const char* key = nullptr;
  const char* value = nullptr;
  ASSERT_EQ(sb_packbuff_unpack_key_with_string_value(r.get(), &key, &type, &value, &length), 0);
  EXPECT_STREQ(key, "key");
  EXPECT_EQ(key, reinterpret_cast<const char*>(base + 136));
  EXPECT_EQ(type, 11);
  EXPECT_STREQ(value, "value");
  EXPECT_EQ(length, 5u);
  EXPECT_EQ(cursor(r.get()), 160);

  const char* empty = sb_packbuff_unpack_string(r.get(), &length, &error);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(length, 0u);
  EXPECT_STREQ(empty, "");

  ASSERT_EQ(sb_packbuff_unpack_key_with_string_value(r.get(), &key, &type, &value, &length), 0);
  EXPECT_STREQ(key, "");
  EXPECT_EQ(type, 13);
  EXPECT_EQ(std::string(value, length), kPath);

  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 0xFFFFFFFFu);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(cursor(r.get()), 296);
  EXPECT_FALSE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 0u);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(sb_packbuff_skip_item(r.get()), EINVAL);
  EXPECT_EQ(cursor(r.get()), 296);

  // Skipping walks the same item boundaries.
  BufferPtr s = reader(block);
  std::vector<ptrdiff_t> starts;
  do starts.push_back(cursor(s.get()));
  while (sb_packbuff_skip_item(s.get()) == 0);
  EXPECT_EQ(starts, (std::vector<ptrdiff_t>{0, 8, 104, 120, 128, 144, 160, 176, 192, 288, 296}));
}

TEST(VSAPackBuffer, KeyValueReadStopsAtTheFirstError) {
  HeapBlock block(
      concat({item(1, 1, 5), item(2, 2, 2, std::string("k\0", 2), 6), item(1, 3, 6), endItem()}));
  BufferPtr r = reader(block);
  const char* key = "untouched";
  const char* value = "untouched";
  uint16_t type = 77;
  size_t length = 77;
  // The key is no string: nothing moves.
  EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(r.get(), &key, &type, &value, &length),
            EINVAL);
  EXPECT_EQ(cursor(r.get()), 0);
  ASSERT_EQ(sb_packbuff_skip_item(r.get()), 0);
  // The value is no string: the key was read, the outputs stay.
  EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(r.get(), &key, &type, &value, &length),
            EINVAL);
  EXPECT_EQ(cursor(r.get()), 24);
  EXPECT_STREQ(key, "untouched");
  EXPECT_STREQ(value, "untouched");
  EXPECT_EQ(type, 77);
  EXPECT_EQ(length, 77u);
  int error = 0;
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 6u);
  EXPECT_EQ(error, 0);
}

TEST(VSAPackBuffer, MalformedStringsAreEinvalOnRead) {
  HeapBlock block(concat({item(2, 1, 0), item(2, 2, 3, "abc", 5),
                          item(2, 3, 4, std::string("a\0b\0", 4), 4), endItem()}));
  BufferPtr r = reader(block);
  int error = 0;
  size_t length = 0;
  // Length 0: not even a NUL.
  EXPECT_EQ(sb_packbuff_unpack_string(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(cursor(r.get()), 0);
  // Skipping it is fine: it is a well-formed 8-byte item.
  ASSERT_EQ(sb_packbuff_skip_item(r.get()), 0);
  EXPECT_EQ(cursor(r.get()), 8);
  // Its last byte is no NUL.
  EXPECT_EQ(sb_packbuff_unpack_string(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(cursor(r.get()), 8);
  // The same item read as bytes.
  const char* bytes = static_cast<const char*>(sb_packbuff_unpack_bytes(r.get(), &length, &error));
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(bytes, nullptr);
  ASSERT_EQ(sb_packbuff_skip_item(r.get()), 0);
  // An embedded NUL is allowed; the length counts it.
  const char* text = sb_packbuff_unpack_string(r.get(), &length, &error);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(length, 3u);
  EXPECT_EQ(std::string(text, length), std::string("a\0b", 3));
}

TEST(VSAPackBuffer, EndAndUnknownItemsCannotBeSkipped) {
  HeapBlock block(concat({item(4, 21, 0), item(0xFFFF, 22, 0), endItem()}));
  BufferPtr r = reader(block);
  uint16_t type = 0;
  ASSERT_TRUE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(type, 21);
  EXPECT_EQ(sb_packbuff_skip_item(r.get()), EINVAL);
  int error = 0;
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 0u);
  EXPECT_EQ(error, EINVAL);
  size_t length = 0;
  EXPECT_EQ(sb_packbuff_unpack_string(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(sb_packbuff_unpack_bytes(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, EINVAL);
  EXPECT_EQ(cursor(r.get()), 0);
  r->item += 8;
  ASSERT_TRUE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(type, 22);
  EXPECT_EQ(sb_packbuff_skip_item(r.get()), EINVAL);
  r->item += 8;
  EXPECT_FALSE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(sb_packbuff_skip_item(r.get()), EINVAL);
  EXPECT_EQ(cursor(r.get()), 16);
}

// ---------------------------------------------------------------------------
// Hostile storage: every case below sits in a heap block of exactly its
// size, so a read past the checks would be reported by the address
// sanitizer.

TEST(VSAPackBuffer, DataLengthRunningPastTheStorageIsErange) {
  for (uint32_t claimed : {17u, 100u, 0xFFFFFFF9u, 0xFFFFFFFFu, 0x7FFFFFFFu}) {
    HeapBlock block(item(3, 1, claimed, std::string(16, 'q')));
    BufferPtr r = reader(block);
    int error = 0;
    size_t length = 0;
    EXPECT_EQ(sb_packbuff_unpack_bytes(r.get(), &length, &error), nullptr) << claimed;
    EXPECT_EQ(error, ERANGE) << claimed;
    EXPECT_EQ(sb_packbuff_skip_item(r.get()), ERANGE) << claimed;
    EXPECT_EQ(cursor(r.get()), 0);
    uint16_t type = 0;
    EXPECT_TRUE(sb_packbuff_get_item_value_type(r.get(), &type));  // the header is inside

    HeapBlock text(item(2, 1, claimed, std::string(16, 'q')));
    BufferPtr t = reader(text);
    EXPECT_EQ(sb_packbuff_unpack_string(t.get(), &length, &error), nullptr) << claimed;
    EXPECT_EQ(error, ERANGE) << claimed;
  }
}

TEST(VSAPackBuffer, ItemFillingTheStorageHasNoNextItem) {
  // Data that ends exactly at the end of the storage: nothing follows it.
  HeapBlock bytes(item(3, 1, 16, std::string(16, 'q')));
  BufferPtr r = reader(bytes);
  int error = 0;
  size_t length = 0;
  EXPECT_EQ(sb_packbuff_unpack_bytes(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, ERANGE);
  EXPECT_EQ(sb_packbuff_skip_item(r.get()), ERANGE);
  EXPECT_EQ(cursor(r.get()), 0);

  // An inline value as the last item: reported, with ERANGE, and the
  // cursor stays.
  HeapBlock last(item(1, 3, 77));
  BufferPtr u = reader(last);
  EXPECT_EQ(sb_packbuff_unpack_uint32(u.get(), &error), 77u);
  EXPECT_EQ(error, ERANGE);
  EXPECT_EQ(cursor(u.get()), 0);
  EXPECT_EQ(sb_packbuff_skip_item(u.get()), ERANGE);
}

TEST(VSAPackBuffer, TruncatedHeaderIsErange) {
  Bytes twelve = concat({item(1, 1, 5), Bytes{2, 0, 1, 0}});
  HeapBlock block(twelve);
  BufferPtr r = reader(block);
  int error = -1;
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 5u);
  EXPECT_EQ(error, 0);
  EXPECT_EQ(cursor(r.get()), 8);
  uint16_t type = 0xABCD;
  EXPECT_FALSE(sb_packbuff_get_item_value_type(r.get(), &type));
  EXPECT_EQ(type, 0xABCD);
  EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 0u);
  EXPECT_EQ(error, ERANGE);
  size_t length = 0;
  EXPECT_EQ(sb_packbuff_unpack_string(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, ERANGE);
  EXPECT_EQ(sb_packbuff_unpack_bytes(r.get(), &length, &error), nullptr);
  EXPECT_EQ(error, ERANGE);
  EXPECT_EQ(sb_packbuff_skip_item(r.get()), ERANGE);
  const char* key = nullptr;
  const char* value = nullptr;
  EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(r.get(), &key, &type, &value, &length),
            ERANGE);
  EXPECT_EQ(cursor(r.get()), 8);

  // Storage shorter than one header.
  for (size_t size : {size_t(0), size_t(1), size_t(7)}) {
    HeapBlock tiny(Bytes(size, 1));
    BufferPtr t = reader(tiny);
    ASSERT_TRUE(t);
    EXPECT_FALSE(sb_packbuff_get_item_value_type(t.get(), &type)) << size;
    EXPECT_EQ(sb_packbuff_unpack_uint32(t.get(), &error), 0u);
    EXPECT_EQ(error, ERANGE) << size;
    EXPECT_EQ(sb_packbuff_skip_item(t.get()), ERANGE) << size;
  }
}

TEST(VSAPackBuffer, CursorOutsideTheStorageIsErange) {
  HeapBlock block(concat({item(1, 1, 5), endItem()}));
  BufferPtr r = reader(block);
  uint8_t* const start = r->item;
  // Past the end, before the start, misaligned so that the header would
  // cross the end, and no cursor at all.
  for (uint8_t* at :
       {start + 16, start + 64, start - 8, start + 9, static_cast<uint8_t*>(nullptr)}) {
    r->item = at;
    int error = 0;
    EXPECT_EQ(sb_packbuff_unpack_uint32(r.get(), &error), 0u);
    EXPECT_EQ(error, ERANGE);
    uint16_t type = 0;
    EXPECT_FALSE(sb_packbuff_get_item_value_type(r.get(), &type));
    EXPECT_EQ(sb_packbuff_skip_item(r.get()), ERANGE);
    size_t length = 0;
    EXPECT_EQ(sb_packbuff_unpack_string(r.get(), &length, &error), nullptr);
    EXPECT_EQ(error, ERANGE);
    EXPECT_EQ(r->item, at);
  }
}

// ---------------------------------------------------------------------------
// Release

TEST(VSAPackBuffer, FreeReleasesAsTheDeallocTypeSays) {
  sb_packbuff_free(nullptr);

  // free(): the heap storage goes with the buffer (a leak checker or a
  // double free would show otherwise).
  auto* heap = static_cast<uint8_t*>(std::malloc(64));
  sb_packbuff_free(sb_packbuff_init_with_buffer(heap, 64, false, SB_PACKBUFF_DEALLOC_FREE));

  // Mapped storage is unmapped, all bytes_allocated of it.
  const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
  void* mapped =
      mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(mapped, MAP_FAILED);
  sb_packbuff_free(sb_packbuff_init_with_buffer(mapped, 2 * page, false, SB_PACKBUFF_DEALLOC_VM));
  errno = 0;
  EXPECT_EQ(msync(mapped, page, MS_ASYNC), -1);
  EXPECT_EQ(errno, ENOMEM);
  errno = 0;
  EXPECT_EQ(msync(static_cast<uint8_t*>(mapped) + page, page, MS_ASYNC), -1);
  EXPECT_EQ(errno, ENOMEM);

  // Caller storage stays.
  uint8_t storage[16] = {};
  sb_packbuff_free(sb_packbuff_init_with_buffer(storage, 16, false, SB_PACKBUFF_DEALLOC_NONE));
  EXPECT_EQ(Bytes(storage, storage + 16), Bytes(16, 0));
}

TEST(VSAPackBuffer, FailedUnmapIsLoggedWithAddressAndSize) {
  const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
  void* mapped = mmap(nullptr, page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(mapped, MAP_FAILED);
  uint8_t* misaligned = static_cast<uint8_t*>(mapped) + 8;
  testing::internal::CaptureStderr();
  sb_packbuff_free(sb_packbuff_init_with_buffer(misaligned, 64, false, SB_PACKBUFF_DEALLOC_VM));
  const std::string log = testing::internal::GetCapturedStderr();
  EXPECT_NE(log.find(format("%p", static_cast<void*>(misaligned))), std::string::npos) << log;
  EXPECT_NE(log.find("64"), std::string::npos) << log;
  EXPECT_NE(log.find("munmap"), std::string::npos) << log;
  // Nothing was unmapped.
  EXPECT_EQ(msync(mapped, page, MS_ASYNC), 0);
  munmap(mapped, page);
}

// ---------------------------------------------------------------------------
// The dump

TEST(VSAPackBuffer, PrintListsEveryItem) {
  BufferPtr b(sb_packbuff_new(0));
  const uint8_t three[3] = {1, 2, 3};
  ASSERT_EQ(sb_packbuff_pack_uint32(b.get(), 5, 42), 0);
  ASSERT_EQ(sb_packbuff_pack_string(b.get(), 7, "ab", 2), 0);
  ASSERT_EQ(sb_packbuff_pack_bytes(b.get(), 9, three, 3), 0);
  ASSERT_EQ(sb_packbuff_pack_string(b.get(), 8, "12345678", 8), 0);
  const uint8_t* p = b->item_buffer;
  const std::string expected =
      printedHeader(b.get(), "free()") +
      format("     0:%p -- value type 5 -- inline value: 42\n", static_cast<const void*>(p)) +
      format("     1:%p -- value type 7 -- string (%p, 5 pad bytes, size: 3): \n     `ab'\n",
             static_cast<const void*>(p + 8), static_cast<const void*>(p + 16)) +
      format("     2:%p -- value type 9 -- bytes (%p, 5 pad bytes, size: 3)\n",
             static_cast<const void*>(p + 24), static_cast<const void*>(p + 32)) +
      format("     3:%p -- value type 8 -- string (%p, 7 pad bytes, size: 9): \n     `12345678'\n",
             static_cast<const void*>(p + 40), static_cast<const void*>(p + 48)) +
      format(">>   4: %p -- END\n", static_cast<const void*>(p + 64));
  EXPECT_EQ(printed(b.get()), expected);

  testing::internal::CaptureStdout();
  sb_packbuff_print(b.get());
  EXPECT_EQ(testing::internal::GetCapturedStdout(), expected);

  // Reading: the cursor marks the next item.
  HeapBlock block(bytesOf(b.get()));
  BufferPtr r = reader(block);
  ASSERT_EQ(sb_packbuff_skip_item(r.get()), 0);
  const uint8_t* q = block.data();
  EXPECT_EQ(
      printed(r.get()),
      printedHeader(r.get(), "None") +
          format("     0:%p -- value type 5 -- inline value: 42\n", static_cast<const void*>(q)) +
          format(">>   1:%p -- value type 7 -- string (%p, 5 pad bytes, size: 3): \n     "
                 "`ab'\n",
                 static_cast<const void*>(q + 8), static_cast<const void*>(q + 16)) +
          format("     2:%p -- value type 9 -- bytes (%p, 5 pad bytes, size: 3)\n",
                 static_cast<const void*>(q + 24), static_cast<const void*>(q + 32)) +
          format("     3:%p -- value type 8 -- string (%p, 7 pad bytes, size: 9): \n     "
                 "`12345678'\n",
                 static_cast<const void*>(q + 40), static_cast<const void*>(q + 48)) +
          format("     4: %p -- END\n", static_cast<const void*>(q + 64)));
}

TEST(VSAPackBuffer, PrintNamesDeallocTypes) {
  uint8_t storage[8];
  for (auto [type, name] : {std::pair<uint32_t, const char*>{SB_PACKBUFF_DEALLOC_NONE, "None"},
                            {SB_PACKBUFF_DEALLOC_VM, "vm_deallocate()"},
                            {3, "<Unknown>"},
                            {0xFFFFFFFF, "<Unknown>"}}) {
    sb_packbuff* b = sb_packbuff_init_with_buffer(storage, 8, false, type);
    EXPECT_EQ(printed(b),
              printedHeader(b, name) + format(">>   0: %p -- END\n", static_cast<void*>(storage)));
    b->dealloc_type = SB_PACKBUFF_DEALLOC_NONE;  // the storage is on the stack
    sb_packbuff_free(b);
  }
  EXPECT_EQ(printed(nullptr), format("packbuff: %p\n", static_cast<void*>(nullptr)));
}

TEST(VSAPackBuffer, PrintStopsAtHostileItems) {
  // A string without its NUL inside the storage: only its bytes are shown.
  HeapBlock unterminated(item(2, 1, 8, "abcdefgh"));
  BufferPtr a = reader(unterminated);
  const uint8_t* p = unterminated.data();
  EXPECT_EQ(printed(a.get()),
            printedHeader(a.get(), "None") +
                format(">>   0:%p -- value type 1 -- string (%p, 0 pad bytes, size: 8): \n     "
                       "`abcdefgh'\n",
                       static_cast<const void*>(p), static_cast<const void*>(p + 8)) +
                ">> item pointer exceeds end of buffer. <<\n");

  // A length claiming more than there is.
  HeapBlock longer(item(2, 1, 100, "abcd"));
  BufferPtr b = reader(longer);
  p = longer.data();
  EXPECT_EQ(printed(b.get()),
            printedHeader(b.get(), "None") +
                format(">>   0:%p -- value type 1 -- string (%p, 4 pad bytes, size: 100): \n     "
                       "`abcd'\n",
                       static_cast<const void*>(p), static_cast<const void*>(p + 8)) +
                ">> item pointer exceeds end of buffer. <<\n");

  // A length whose padding wraps 32 bits.
  HeapBlock wraps(concat({item(1, 1, 1), item(3, 2, 0xFFFFFFF9u), endItem()}));
  BufferPtr c = reader(wraps);
  p = wraps.data();
  EXPECT_EQ(
      printed(c.get()),
      printedHeader(c.get(), "None") +
          format(">>   0:%p -- value type 1 -- inline value: 1\n", static_cast<const void*>(p)) +
          format("     1:%p -- value type 2 -- bytes (%p, 7 pad bytes, size: 4294967289)\n",
                 static_cast<const void*>(p + 8), static_cast<const void*>(p + 16)) +
          ">> item pointer overflow. <<\n");

  // An unknown item type ends the walk after its line.
  HeapBlock unknown(concat({item(9, 3, 0), item(1, 1, 1), endItem()}));
  BufferPtr d = reader(unknown);
  p = unknown.data();
  EXPECT_EQ(printed(d.get()), printedHeader(d.get(), "None") +
                                  format(">>   0:%p -- value type 3 -- *Unknown item type* 9\n",
                                         static_cast<const void*>(p)));

  // A truncated header, and storage without a single header.
  HeapBlock twelve(concat({item(1, 4, 2), Bytes{1, 0, 0, 0}}));
  BufferPtr e = reader(twelve);
  p = twelve.data();
  EXPECT_EQ(printed(e.get()), printedHeader(e.get(), "None") +
                                  format(">>   0:%p -- value type 4 -- inline value: 2\n",
                                         static_cast<const void*>(p)) +
                                  ">> item pointer exceeds end of buffer. <<\n");
  HeapBlock four(Bytes{1, 0, 0, 0});
  BufferPtr f = reader(four);
  EXPECT_EQ(printed(f.get()),
            printedHeader(f.get(), "None") + ">> item pointer exceeds end of buffer. <<\n");

  // A writer's walk stops at bytes used, even when the storage goes on.
  HeapBlock spare(concat({item(1, 5, 6), item(1, 5, 7), endItem()}));
  BufferPtr g = reader(spare);
  sb_packbuff_set_size(g.get(), 12);
  p = spare.data();
  EXPECT_EQ(printed(g.get()), printedHeader(g.get(), "None") +
                                  format(">>   0:%p -- value type 5 -- inline value: 6\n",
                                         static_cast<const void*>(p)) +
                                  ">> item pointer exceeds end of buffer. <<\n");
}

}  // namespace
