// The result codes: one list, each number once, and the README's table of
// them (what clients read) equal to it.
#include <gtest/gtest.h>

#include <fstream>
#include <regex>
#include <set>
#include <string>

#include "base/VSAError.h"

TEST(VSAResultCodes, EachNumberNamesOneCodeWithAMeaning) {
  std::set<VSAResultCode> seen;
  VSAResultCode previous = 0;
  for (const auto& d : VSAResult::kAll) {
    EXPECT_TRUE(seen.insert(d.code).second) << d.name << " reuses " << d.code;
    EXPECT_GT(d.code, previous) << d.name << " is out of order";
    previous = d.code;
    EXPECT_NE(std::string(d.meaning), "") << d.name;
    EXPECT_STREQ(VSAResult::meaning(d.code), d.meaning);
  }
  EXPECT_EQ(VSAResult::meaning(2), nullptr) << "not a result code";
  EXPECT_EQ(VSAResult::meaning(VSAResult::kSuccess), std::string("success"));
}

TEST(VSAResultCodes, TheReadmeTableIsTheList) {
  std::ifstream readme(std::string(VESSA_SOURCE_DIR) + "/README.md");
  ASSERT_TRUE(readme.good());
  std::regex row(R"(^\| (\d+) \| `(k\w+)` \| (.+) \|$)");
  size_t rows = 0;
  for (std::string line; std::getline(readme, line);) {
    std::smatch m;
    if (!std::regex_match(line, m, row)) continue;
    ASSERT_LT(rows, std::size(VSAResult::kAll)) << "more rows than codes: " << line;
    const auto& d = VSAResult::kAll[rows++];
    EXPECT_EQ(std::stoull(m[1]), d.code) << line;
    EXPECT_EQ(m[2], d.name) << line;
    EXPECT_EQ(m[3], d.meaning) << line;
  }
  EXPECT_EQ(rows, std::size(VSAResult::kAll)) << "every code has its row";
}
