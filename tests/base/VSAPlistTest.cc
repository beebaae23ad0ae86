#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "base/VSAPathString.h"
#include "base/VSAPlist.h"

namespace {

class VSAPlistFiles : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/vessa-plist-XXXXXX";
    dir_ = mkdtemp(tmpl);
  }
  void TearDown() override { std::filesystem::remove_all(dir_); }
  std::string dir_;
};

TEST(VSAPlist, XMLRoundTripKeepsNegativeNumbersAndNesting) {
  VSAValue v = VSAValue::Dictionary{
      {"neg", VSAValue(int64_t(-42))},
      {"pos", VSAValue(uint64_t(42))},
      {"str", VSAValue("a & <b>")},
      {"arr", VSAValue(VSAValue::Array{VSAValue(true), VSAValue(1.5)})},
      {"data", VSAValue(VSAValue::Data{9, 8, 7})},
  };
  VSAErrorRef error;
  auto xml = VSAPlist::serialize(v, VSAPlist::Format::XML, &error);
  ASSERT_TRUE(xml);
  auto back = VSAPlist::parse(*xml, &error);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, v);
}

TEST(VSAPlist, GarbageIsAnErrorNotACrash) {
  VSAErrorRef error;
  std::string junk = "<plist><dict><key>a</key>";
  EXPECT_FALSE(VSAPlist::parse(reinterpret_cast<const uint8_t*>(junk.data()), junk.size(), &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), kVSACocoaErrorDomain);
  EXPECT_FALSE(VSAPlist::parse(nullptr, 0, &error));
}

TEST_F(VSAPlistFiles, WriteIsAtomicAndReadsBack) {
  std::string path = VSAPathJoin(dir_, "a.plist");
  VSAValue v = VSAValue::Dictionary{{"k", VSAValue("v1")}};
  VSAErrorRef error;
  ASSERT_TRUE(VSA_writeToURL(v, path, kVSAWriteFileProtectionNone, &error));
  v.set("k", VSAValue("v2"));
  ASSERT_TRUE(VSA_writeToURL(v, path, 0, &error));
  auto back = VSA_dictionaryWithContentsOfURL(path, 0, &error);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, v);
  // No temporary file is left beside the target.
  int entries = 0;
  for (auto& e : std::filesystem::directory_iterator(dir_)) (void)e, ++entries;
  EXPECT_EQ(entries, 1);
}

TEST_F(VSAPlistFiles, FailedWriteLeavesTheOldFileIntact) {
  std::string path = VSAPathJoin(dir_, "keep.plist");
  VSAValue v = VSAValue::Dictionary{{"k", VSAValue("old")}};
  VSAErrorRef error;
  ASSERT_TRUE(VSA_writeToURL(v, path, 0, &error));
  VSAValue bad = VSAValue::Dictionary{{"k", VSAValue(std::string("\xFF\xFE"))}};
  EXPECT_FALSE(VSA_writeToURL(bad, path, 0, &error));
  // Writing into a directory that cannot be written also fails cleanly.
  EXPECT_FALSE(VSA_writeToURL(v, VSAPathJoin(dir_, "missing/dir/x.plist"), 0, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), kVSAPOSIXErrorDomain);
  EXPECT_EQ(error->code(), ENOENT);
  auto back = VSA_dictionaryWithContentsOfURL(path, 0, &error);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back->get("k")->stringValue(), "old");
}

TEST_F(VSAPlistFiles, NonDictionaryRootFailsWithCode2048) {
  std::string path = VSAPathJoin(dir_, "array.plist");
  VSAErrorRef error;
  auto bytes =
      VSAPlist::serialize(VSAValue(VSAValue::Array{VSAValue(1)}), VSAPlist::Format::Binary, &error);
  ASSERT_TRUE(VSAWriteFileAtomically(path, *bytes, 0644, &error));
  EXPECT_FALSE(VSA_dictionaryWithContentsOfURL(path, 0, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), kVSACocoaErrorDomain);
  EXPECT_EQ(error->code(), 2048);
  EXPECT_FALSE(VSA_dictionaryWithContentsOfURL(VSAPathJoin(dir_, "none.plist"), 0, &error));
  EXPECT_EQ(error->code(), ENOENT);
}

TEST(VSAPathString, DotDotComponents) {
  EXPECT_TRUE(containsDotDotPathComponents(".."));
  EXPECT_TRUE(containsDotDotPathComponents("a/../b"));
  EXPECT_TRUE(containsDotDotPathComponents("/a/b/.."));
  EXPECT_FALSE(containsDotDotPathComponents("a/..b/c.."));
  EXPECT_FALSE(containsDotDotPathComponents("/a/./b"));
  EXPECT_FALSE(containsDotDotPathComponents(""));
  EXPECT_EQ(stringWithFileSystemRepresentation("ab\0cd", 5), "ab");
  EXPECT_EQ(VSAPathJoin("/a/", "/b"), "/a/b");
}

}  // namespace
