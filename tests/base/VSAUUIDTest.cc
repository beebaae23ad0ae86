#include <gtest/gtest.h>

#include "base/VSAUUID.h"

namespace {

TEST(VSAUUID, TextFormRoundTripsInEitherCase) {
  for (int i = 0; i < 200; ++i) {
    VSAUUID u = VSAUUID::random();
    std::string upper = u.string();
    std::string lower = upper;
    for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    ASSERT_EQ(VSAUUID::parse(upper), u) << upper;
    ASSERT_EQ(VSAUUID::parse(lower), u) << lower;
  }
  auto mixed = VSAUUID::parse("00fF10aB-9c8D-4e7F-a0b1-C2d3E4f5A6b7");
  ASSERT_TRUE(mixed);
  EXPECT_EQ(mixed->string(), "00FF10AB-9C8D-4E7F-A0B1-C2D3E4F5A6B7");
}

// Directory names under a class directory are attacker-chosen: anything but
// the exact 8-4-4-4-12 hex form is refused.
TEST(VSAUUID, AnythingButTheExactFormIsRefused) {
  const std::string good = "8F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7F";
  ASSERT_TRUE(VSAUUID::parse(good));
  const char* bad[] = {
      "",
      "8F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7",    // short
      "8F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7F0",  // long
      "8F0C7E3A5-B1D-4C9E-A2F4-6D3B1E0C9A7F",   // dash moved
      "8F0C7E3A-5B1D-4C9E-A2F4_6D3B1E0C9A7F",   // not a dash
      "8F0C7E3G-5B1D-4C9E-A2F4-6D3B1E0C9A7F",   // not hex
      " F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7F",   // space
      "+F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7F",   // sign
      "8F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7:",   // one past '9'
      "8F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7@",   // one before 'A'
      "8F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7`",   // one before 'a'
      "------------------------------------",
  };
  for (const char* text : bad) EXPECT_FALSE(VSAUUID::parse(text)) << '"' << text << '"';
  std::string withNul = good;
  withNul[35] = '\0';
  EXPECT_FALSE(VSAUUID::parse(withNul));
}

}  // namespace
