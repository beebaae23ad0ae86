// The container classes: each name once, numbered 1..13 in order, each with
// its directory's path component; the per-user and global lists agree with
// the predicates, for every number a client could send.
#include <gtest/gtest.h>

#include <algorithm>
#include <iterator>
#include <set>
#include <string>

#include "model/VSAContainerClass.h"

namespace {

struct Row {
  VSAContainerClass number;
  const char* name;
  const char* pathComponent;
};
constexpr Row kRows[] = {
#define VSA_CONTAINER_CLASS_ROW(name, value, pathComponent) {VSAClass::name, #name, pathComponent},
    VSA_CONTAINER_CLASSES(VSA_CONTAINER_CLASS_ROW)
#undef VSA_CONTAINER_CLASS_ROW
};

bool contains(const VSAContainerClass* begin, const VSAContainerClass* end, VSAContainerClass c) {
  return std::find(begin, end, c) != end;
}

TEST(VSAContainerClass, EachNameOnceNumberedOneToThirteenWithItsDirectory) {
  ASSERT_EQ(std::size(kRows), 13u);
  std::set<std::string> names, paths;
  VSAContainerClass expected = kVSAContainerClassMin;
  for (const Row& row : kRows) {
    EXPECT_TRUE(names.insert(row.name).second) << row.name;
    EXPECT_TRUE(paths.insert(row.pathComponent).second) << row.name;
    EXPECT_EQ(row.number, expected++) << row.name << " is out of order";
    EXPECT_TRUE(VSAContainerClassIsValid(row.number)) << row.name;
    EXPECT_STREQ(VSAContainerClassPathComponent(row.number), row.pathComponent) << row.name;
  }
  EXPECT_EQ(expected - 1, kVSAContainerClassMax);
  EXPECT_STREQ(VSAContainerClassPathComponent(VSAClass::kUndefined), "Undefined");
  EXPECT_STREQ(VSAContainerClassPathComponent(14), "MAX");
  EXPECT_STREQ(VSAContainerClassPathComponent(99), "MAX");
  // The numbers stored on disk and sent by clients stay what they were.
  EXPECT_EQ(VSAClass::kBundleApplication, 1u);
  EXPECT_EQ(VSAClass::kDataApplication, 2u);
  EXPECT_EQ(VSAClass::kDataPlugin, 4u);
  EXPECT_EQ(VSAClass::kAppGroup, 7u);
  EXPECT_EQ(VSAClass::kSystemData, 12u);
  EXPECT_EQ(VSAClass::kSystemGroup, 13u);
}

TEST(VSAContainerClass, PerUserAndGlobalListsAgreeWithThePredicates) {
  const auto* perUserEnd = std::end(kVSAPerUserContainerClasses);
  const auto* globalEnd = std::end(kVSAGlobalContainerClasses);
  EXPECT_TRUE(std::is_sorted(std::begin(kVSAPerUserContainerClasses), perUserEnd));
  EXPECT_TRUE(std::is_sorted(std::begin(kVSAGlobalContainerClasses), globalEnd));
  for (VSAContainerClass c = 0; c <= 20; ++c) {
    bool perUser = contains(std::begin(kVSAPerUserContainerClasses), perUserEnd, c);
    bool global = contains(std::begin(kVSAGlobalContainerClasses), globalEnd, c);
    EXPECT_EQ(perUser, VSAContainerClassIsPerUser(c)) << c;
    EXPECT_EQ(global, VSAContainerClassIsBundle(c) || VSAContainerClassIsSystem(c)) << c;
    EXPECT_FALSE(perUser && global) << c;
    EXPECT_EQ(perUser || global, VSAContainerClassIsValid(c)) << c;
  }
  EXPECT_FALSE(VSAContainerClassIsValid(UINT64_MAX));
}

}  // namespace
