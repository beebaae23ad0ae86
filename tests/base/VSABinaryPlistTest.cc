#include <gtest/gtest.h>

#include <cstring>
#include <limits>

#include "base/VSABinaryPlist.h"
#include "base/VSAPlist.h"

namespace {

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
      encode(VSAValue::Dictionary{{"Command", VSAValue(3u)},
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
  EXPECT_EQ(why, "too many values");
}

TEST(VSABinaryPlist, NestingDepthIsBounded) {
  VSAValue v = VSAValue(1);
  for (int i = 0; i < VSABinaryPlist::kMaxDepth + 5; ++i) v = VSAValue(VSAValue::Array{v});
  auto bytes = encode(v);
  std::string why;
  EXPECT_FALSE(VSABinaryPlist::decode(bytes.data(), bytes.size(), &why));
  EXPECT_EQ(why, "nesting too deep");
}

}  // namespace
