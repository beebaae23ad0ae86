#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <limits>

#include "base/VSABinaryPlist.h"
#include "base/VSACommands.h"
#include "base/VSAPlist.h"

namespace {

void appendBE(std::vector<uint8_t>& out, uint64_t v, int size) {
  for (int i = size - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

VSAValue roundTrip(const VSAValue& v,
                   VSABinaryPlist::UUIDForm form = VSABinaryPlist::UUIDForm::Data) {
  std::string why;
  auto bytes = VSABinaryPlist::encode(v, form, &why);
  EXPECT_TRUE(bytes) << why;
  auto back = VSABinaryPlist::decode(bytes->data(), bytes->size(), &why);
  EXPECT_TRUE(back) << why;
  return back ? *back : VSAValue();
}

std::vector<uint8_t> encode(const VSAValue& v) {
  std::string why;
  return *VSABinaryPlist::encode(v, VSABinaryPlist::UUIDForm::Data, &why);
}

TEST(VSABinaryPlist, IntegerExtremesKeepValueAndSign) {
  const int64_t i64min = std::numeric_limits<int64_t>::min();
  const int64_t i64max = std::numeric_limits<int64_t>::max();
  const uint64_t u64max = std::numeric_limits<uint64_t>::max();
  for (int64_t v : {i64min, int64_t(-1), int64_t(-129), i64max}) {
    VSAValue back = roundTrip(VSAValue(v));
    ASSERT_TRUE(back.int64Value()) << v;
    EXPECT_EQ(*back.int64Value(), v);
  }
  for (uint64_t v : {uint64_t(0), uint64_t(255), uint64_t(256), uint64_t(65536), uint64_t(1) << 32,
                     uint64_t(i64max) + 1, u64max}) {
    VSAValue back = roundTrip(VSAValue(v));
    ASSERT_TRUE(back.uint64Value()) << v;
    EXPECT_EQ(*back.uint64Value(), v);
  }
  // The two 64-bit patterns of -1 and UINT64_MAX must not be confused.
  EXPECT_FALSE(roundTrip(VSAValue(u64max)).int64Value());
  EXPECT_FALSE(roundTrip(VSAValue(int64_t(-1))).uint64Value());
}

TEST(VSABinaryPlist, EveryValueTypeRoundTrips) {
  VSAUUID uuid = VSAUUID::random();
  VSAValue::Dictionary inner = {{"deep", VSAValue(VSAValue::Array{VSAValue(1), VSAValue("x")})}};
  VSAValue v = VSAValue::Dictionary{
      {"null", VSAValue()},
      {"yes", VSAValue(true)},
      {"no", VSAValue(false)},
      {"real", VSAValue(3.25)},
      {"negreal", VSAValue(-1e300)},
      {"ascii", VSAValue("hello")},
      {"unicode", VSAValue("gr\xC3\xBC\xC3\x9F \xF0\x9F\x98\x80")},  // BMP and astral
      {"empty", VSAValue("")},
      {"data", VSAValue(VSAValue::Data{0, 1, 2, 255})},
      {"date", VSAValue(VSADate{123456.5})},
      {"nested", VSAValue(inner)},
      {"array", VSAValue(VSAValue::Array{})},
  };
  EXPECT_EQ(roundTrip(v), v);
  // UUIDs travel as 16 bytes on the wire and as text in files.
  VSAValue wire = roundTrip(VSAValue(uuid), VSABinaryPlist::UUIDForm::Data);
  ASSERT_TRUE(wire.isData());
  EXPECT_EQ(wire.uuidValue(), uuid);
  VSAValue file = roundTrip(VSAValue(uuid), VSABinaryPlist::UUIDForm::String);
  ASSERT_TRUE(file.isString());
  EXPECT_EQ(*file.stringValue(), uuid.string());
  EXPECT_EQ(file.uuidValue(), uuid);
}

TEST(VSABinaryPlist, LargeCollectionsUseWideReferencesAndCounts) {
  VSAValue::Array big;
  for (int i = 0; i < 70000; ++i) big.push_back(VSAValue(static_cast<uint64_t>(i)));
  VSAValue::Dictionary dict;
  for (int i = 0; i < 300; ++i) dict["key" + std::to_string(i)] = VSAValue(std::string(i, 'a'));
  VSAValue v = VSAValue::Dictionary{{"big", VSAValue(big)}, {"dict", VSAValue(dict)}};
  EXPECT_EQ(roundTrip(v), v);
}

TEST(VSABinaryPlist, InvalidUTF8IsRefusedByTheEncoder) {
  std::string why;
  EXPECT_FALSE(VSABinaryPlist::encode(VSAValue(std::string("\xC3\x28")),
                                      VSABinaryPlist::UUIDForm::Data, &why));
  EXPECT_FALSE(VSABinaryPlist::encode(VSAValue(std::string("\xED\xA0\x80")),
                                      VSABinaryPlist::UUIDForm::Data, &why));
  EXPECT_FALSE(why.empty());
}

TEST(VSABinaryPlist, EveryTruncationIsRejectedWithoutCrashing) {
  auto bytes =
      encode(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kStageForDelete)},
                                  {"Identifier", VSAValue("com.a")},
                                  {"List", VSAValue(VSAValue::Array{VSAValue(1), VSAValue(2)})}});
  for (size_t n = 0; n < bytes.size(); ++n) {
    std::string why;
    EXPECT_FALSE(VSABinaryPlist::decode(bytes.data(), n, &why)) << n;
  }
}

TEST(VSABinaryPlist, EveryByteFlipDecodesOrFailsCleanly) {
  auto bytes =
      encode(VSAValue::Dictionary{{"A", VSAValue(VSAValue::Array{VSAValue("x"), VSAValue(-5)})},
                                  {"B", VSAValue(VSAValue::Data{1, 2, 3})}});
  for (size_t i = 0; i < bytes.size(); ++i) {
    for (uint8_t flip : {0x01, 0x0F, 0x80, 0xFF}) {
      auto copy = bytes;
      copy[i] ^= flip;
      std::string why;
      (void)VSABinaryPlist::decode(copy.data(), copy.size(), &why);  // must not crash or hang
    }
  }
  SUCCEED();
}

// Builds a bplist by hand: objects as given, 1-byte refs and offsets.
std::vector<uint8_t> handMade(const std::vector<std::vector<uint8_t>>& objects, uint8_t top = 0) {
  std::vector<uint8_t> out = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<uint8_t> offsets;
  for (const auto& o : objects) {
    offsets.push_back(static_cast<uint8_t>(out.size()));
    out.insert(out.end(), o.begin(), o.end());
  }
  uint8_t table = static_cast<uint8_t>(out.size());
  out.insert(out.end(), offsets.begin(), offsets.end());
  uint8_t trailer[32] = {};
  trailer[6] = 1;
  trailer[7] = 1;
  trailer[15] = static_cast<uint8_t>(objects.size());
  trailer[23] = top;
  trailer[31] = table;
  out.insert(out.end(), trailer, trailer + 32);
  return out;
}

// One-byte strings: ASCII comes through as it is; a stray high byte is
// Latin-1 and becomes its two-byte UTF-8 form, so no decoded string is
// invalid UTF-8.
TEST(VSABinaryPlist, OneByteStringsDecodeAsASCIIOrLatin1) {
  std::string why;
  auto ascii = handMade({{0x53, 'a', '/', 'Z'}});
  auto a = VSABinaryPlist::decode(ascii.data(), ascii.size(), &why);
  ASSERT_TRUE(a) << why;
  EXPECT_EQ(*a->stringValue(), "a/Z");
  auto latin = handMade({{0x53, 'c', 0xE9, 'x'}});
  auto l = VSABinaryPlist::decode(latin.data(), latin.size(), &why);
  ASSERT_TRUE(l) << why;
  EXPECT_EQ(*l->stringValue(), "c\xC3\xA9x");
}

TEST(VSABinaryPlist, HostileStructuresAreRefused) {
  std::string why;
  // An array that contains itself.
  auto cycle = handMade({{0xA1, 0x00}});
  EXPECT_FALSE(VSABinaryPlist::decode(cycle.data(), cycle.size(), &why));
  EXPECT_EQ(why, "reference cycle");
  // A dictionary whose key is a number.
  auto badKey = handMade({{0xD1, 0x01, 0x01}, {0x10, 0x05}});
  EXPECT_FALSE(VSABinaryPlist::decode(badKey.data(), badKey.size(), &why));
  // A reference past the object table.
  auto badRef = handMade({{0xA1, 0x07}});
  EXPECT_FALSE(VSABinaryPlist::decode(badRef.data(), badRef.size(), &why));
  // A count far larger than the file.
  auto badCount = handMade({{0x4F, 0x13, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}});
  EXPECT_FALSE(VSABinaryPlist::decode(badCount.data(), badCount.size(), &why));
  // Shared references that would expand exponentially: 12 arrays of 14
  // references each to the next one (14^12 leaves from a few hundred bytes).
  std::vector<std::vector<uint8_t>> objects;
  for (uint8_t level = 0; level < 12; ++level) {
    std::vector<uint8_t> o = {0xAE};
    for (int k = 0; k < 14; ++k) o.push_back(static_cast<uint8_t>(level + 1));
    objects.push_back(o);
  }
  objects.push_back({0x09});
  auto bomb = handMade(objects);
  EXPECT_FALSE(VSABinaryPlist::decode(bomb.data(), bomb.size(), &why));
  // Each leaf costs at least kValueCost: the byte budget of a few hundred
  // bytes of input runs out long before the count of values does.
  EXPECT_EQ(why, "decoded size exceeds the budget");
}

TEST(VSABinaryPlist, NestingDepthIsBounded) {
  VSAValue v = VSAValue(1);
  for (int i = 0; i < VSABinaryPlist::kMaxDepth + 5; ++i) v = VSAValue(VSAValue::Array{v});
  auto bytes = encode(v);
  std::string why;
  EXPECT_FALSE(VSABinaryPlist::decode(bytes.data(), bytes.size(), &why));
  EXPECT_EQ(why, "nesting too deep");
}

// Builds a bplist by hand with 4-byte offsets and `refSize`-byte references;
// objects may be large.
std::vector<uint8_t> wideHandMade(const std::vector<std::vector<uint8_t>>& objects, int refSize) {
  std::vector<uint8_t> out = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<uint64_t> offsets;
  for (const auto& o : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), o.begin(), o.end());
  }
  uint64_t table = out.size();
  for (uint64_t off : offsets) appendBE(out, off, 4);
  std::vector<uint8_t> trailer(6, 0);
  trailer.push_back(4);
  trailer.push_back(static_cast<uint8_t>(refSize));
  appendBE(trailer, objects.size(), 8);
  appendBE(trailer, 0, 8);
  appendBE(trailer, table, 8);
  out.insert(out.end(), trailer.begin(), trailer.end());
  return out;
}

// An object header with a 4-byte count ("count follows" form).
std::vector<uint8_t> header(uint8_t marker, uint32_t count) {
  std::vector<uint8_t> o = {static_cast<uint8_t>(marker | 0x0F), 0x12};
  appendBE(o, count, 4);
  return o;
}

TEST(VSABinaryPlist, OneStringSharedAMillionTimesIsRefusedByTheBudget) {
  // A 3 MiB list: an array of a million one-byte references to one 2 MiB
  // string. Decoded naively that is 2 TiB of strings.
  constexpr uint32_t kReferences = 1000000;
  constexpr uint32_t kStringBytes = 2u << 20;
  std::vector<uint8_t> array = header(0xA0, kReferences);
  array.insert(array.end(), kReferences, 0x01);
  std::vector<uint8_t> string = header(0x50, kStringBytes);
  string.insert(string.end(), kStringBytes, 'x');
  auto frame = wideHandMade({array, string}, 1);
  ASSERT_LT(frame.size(), 4u << 20);
  std::string why;
  EXPECT_FALSE(VSABinaryPlist::decode(frame.data(), frame.size(), &why));
  EXPECT_EQ(why, "decoded size exceeds the budget");
  // The same frame through the format-detecting parser.
  VSAErrorRef error;
  EXPECT_FALSE(VSAPlist::parse(frame, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), kVSAPropertyListReadCorruptError);
}

TEST(VSABinaryPlist, SharedArraysAreChargedAtEveryReference) {
  // Twenty references to one array of 50,000 small integers: a million
  // values (under the count limit) from 150 KiB, which the budget refuses.
  std::vector<uint8_t> inner = header(0xA0, 50000);
  for (int i = 0; i < 50000; ++i) appendBE(inner, 2, 2);
  std::vector<uint8_t> outer = header(0xA0, 20);
  for (int i = 0; i < 20; ++i) appendBE(outer, 1, 2);
  auto frame = wideHandMade({outer, inner, {0x10, 0x07}}, 2);
  std::string why;
  EXPECT_FALSE(VSABinaryPlist::decode(frame.data(), frame.size(), &why));
  EXPECT_EQ(why, "decoded size exceeds the budget");
  // Two references to it are within the budget.
  outer = header(0xA0, 2);
  appendBE(outer, 1, 2);
  appendBE(outer, 1, 2);
  frame = wideHandMade({outer, inner, {0x10, 0x07}}, 2);
  auto v = VSABinaryPlist::decode(frame.data(), frame.size(), &why);
  ASSERT_TRUE(v) << why;
  EXPECT_EQ((*v->arrayValue())[1].arrayValue()->size(), 50000u);
}

TEST(VSABinaryPlist, SharedScalarsAndLargeValidListsStillDecode) {
  // Writers that share equal objects produce one-byte references to one
  // `true`: 300,000 of them stay within the budget.
  std::vector<uint8_t> array = header(0xA0, 300000);
  array.insert(array.end(), 300000, 0x01);
  auto shared = wideHandMade({array, {0x09}}, 1);
  std::string why;
  auto v = VSABinaryPlist::decode(shared.data(), shared.size(), &why);
  ASSERT_TRUE(v) << why;
  EXPECT_EQ(v->arrayValue()->size(), 300000u);
  EXPECT_LE(VSABinaryPlist::decodedSize(*v), VSABinaryPlist::decodedSizeBudget(shared.size()));

  // A large list as the encoder writes it: 20,000 container records.
  VSAValue::Array records;
  for (int i = 0; i < 20000; ++i) {
    records.push_back(VSAValue(VSAValue::Dictionary{
        {"Identifier", VSAValue("com.example.app" + std::to_string(i))},
        {"Class", VSAValue(static_cast<uint64_t>(i % 13 + 1))},
        {"Path",
         VSAValue("/private/var/mobile/Containers/Data/Application/" + std::to_string(i * 7919))},
        {"Token", VSAValue(VSAValue::Data(64, static_cast<uint8_t>(i)))},
        {"Flags", VSAValue(VSAValue::Array{VSAValue(true), VSAValue(-i)})}}));
  }
  VSAValue big{std::move(records)};
  auto bytes = encode(big);
  ASSERT_GT(bytes.size(), 2u << 20);
  auto back = VSABinaryPlist::decode(bytes.data(), bytes.size(), &why);
  ASSERT_TRUE(back) << why;
  EXPECT_EQ(*back, big);
  EXPECT_LE(VSABinaryPlist::decodedSize(*back), VSABinaryPlist::decodedSizeBudget(bytes.size()));
}

TEST(VSABinaryPlist, DecodedSizeCountsPayloadsAndKeys) {
  EXPECT_EQ(VSABinaryPlist::decodedSize(VSAValue(true)), VSABinaryPlist::kValueCost);
  EXPECT_EQ(VSABinaryPlist::decodedSize(VSAValue("abc")), VSABinaryPlist::kValueCost + 3);
  EXPECT_EQ(VSABinaryPlist::decodedSize(VSAValue(VSAValue::Data(10))),
            VSABinaryPlist::kValueCost + 10);
  VSAValue d(VSAValue::Dictionary{{"key", VSAValue(VSAValue::Array{VSAValue(1), VSAValue("xy")})}});
  // dictionary + key "key" + array + 1 + "xy"
  EXPECT_EQ(VSABinaryPlist::decodedSize(d), 5 * VSABinaryPlist::kValueCost + 3 + 2);
  EXPECT_EQ(VSABinaryPlist::decodedSizeBudget(1000), 8000 + VSABinaryPlist::kDecodedBytesAllowance);
}

TEST(VSABinaryPlist, DeepSharedNestingIsRefused) {
  // 10,000 arrays, each holding the next: refused at the depth bound, not by
  // running out of stack.
  constexpr int kLevels = 10000;
  std::vector<std::vector<uint8_t>> objects;
  for (int i = 0; i < kLevels; ++i) {
    std::vector<uint8_t> o = {0xA1};
    appendBE(o, i + 1, 2);
    objects.push_back(o);
  }
  objects.push_back({0x09});
  auto deep = wideHandMade(objects, 2);
  std::string why;
  EXPECT_FALSE(VSABinaryPlist::decode(deep.data(), deep.size(), &why));
  EXPECT_EQ(why, "nesting too deep");
}

// Sanitizers reserve address space of their own, so RLIMIT_AS cannot model
// a shortage there.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define VSA_TEST_SANITIZED 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define VSA_TEST_SANITIZED 1
#endif
#endif

#ifndef VSA_TEST_SANITIZED
// Runs in the death test's child: lets the address space grow by only
// 16 MiB, decodes `list` and exits 0 if the decoder reported running out of
// memory, 1 if it succeeded, 2 for another failure.
[[noreturn]] void decodeWithLittleMemory(const std::vector<uint8_t>& list) {
  long pages = 0;
  FILE* f = std::fopen("/proc/self/statm", "r");
  if (!f || std::fscanf(f, "%ld", &pages) != 1) _exit(3);
  std::fclose(f);
  rlim_t now = static_cast<rlim_t>(pages) * sysconf(_SC_PAGESIZE);
  struct rlimit limit = {now + (16u << 20), now + (16u << 20)};
  if (setrlimit(RLIMIT_AS, &limit) != 0) _exit(4);
  std::string why;
  auto v = VSABinaryPlist::decode(list.data(), list.size(), &why);
  _exit(v ? 1 : why == "out of memory while decoding" ? 0 : 2);
}

TEST(VSABinaryPlistDeathTest, AllocationFailureIsADecodeFailure) {
  // A 48 MiB data object cannot be copied with 16 MiB to spare: the decoder
  // must say so rather than let std::bad_alloc end the process.
  constexpr uint32_t kBytes = 48u << 20;
  std::vector<uint8_t> data = header(0x40, kBytes);
  data.resize(data.size() + kBytes, 0x5A);
  auto list = wideHandMade({data}, 1);
  EXPECT_EXIT(decodeWithLittleMemory(list), ::testing::ExitedWithCode(0), "");
}
#endif

}  // namespace
