#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>

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

std::vector<uint8_t> bytesOf(const std::string& text) { return {text.begin(), text.end()}; }

std::string nestedXML(size_t levels, const char* tag = "array") {
  std::string xml = "<?xml version=\"1.0\"?><plist version=\"1.0\">";
  for (size_t i = 0; i < levels; ++i) xml += std::string("<") + tag + ">";
  for (size_t i = 0; i < levels; ++i) xml += std::string("</") + tag + ">";
  return xml + "</plist>";
}

TEST(VSAPlist, DeepXMLIsRefusedBeforeLibplistRecursesIntoIt) {
  VSAErrorRef error;
  // 200,000 levels: enough to overflow the stack in libplist's recursion.
  EXPECT_FALSE(VSAPlist::parse(bytesOf(nestedXML(200000)), &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), kVSAPropertyListReadCorruptError);
  EXPECT_FALSE(VSAPlist::parse(bytesOf(nestedXML(200000, "dict")), &error));
  // Just past the bound fails, the bound itself (as the binary decoder
  // counts it) decodes, the same in both formats.
  VSAValue v{VSAValue::Array{}};
  for (int i = 0; i < VSABinaryPlist::kMaxDepth; ++i) v = VSAValue(VSAValue::Array{v});
  for (auto format : {VSAPlist::Format::XML, VSAPlist::Format::Binary}) {
    auto ok = VSAPlist::serialize(v, format, &error);
    ASSERT_TRUE(ok);
    EXPECT_TRUE(VSAPlist::parse(*ok, &error)) << static_cast<int>(format);
    auto deeper = VSAPlist::serialize(VSAValue(VSAValue::Array{v}), format, &error);
    EXPECT_FALSE(VSAPlist::parse(*deeper, &error)) << static_cast<int>(format);
  }
}

TEST(VSAPlist, XMLNestingScanFollowsLibplistTags) {
  auto depth = [](const std::string& xml) {
    return VSAPlist::xmlNestingDepth(reinterpret_cast<const uint8_t*>(xml.data()), xml.size());
  };
  EXPECT_EQ(depth(nestedXML(3)), 3u);
  EXPECT_EQ(depth("<dict><key>a</key><array/><dict/><array><true/></array></dict>"), 2u);
  // Tags inside comments, CDATA, processing instructions and DOCTYPE
  // subsets are text to libplist, and so to the scan.
  EXPECT_EQ(depth("<array><!-- </array><array><array> --><array></array></array>"), 2u);
  EXPECT_EQ(depth("<array><string><![CDATA[<array><array>]]></string></array>"), 1u);
  EXPECT_EQ(depth("<?pi <array><array> ?><!DOCTYPE x [ <array><array> ]><array></array>"), 1u);
  // A closing tag libplist would not take as one does not close a level.
  EXPECT_EQ(depth("<array></array-x><array></ array><array>"), 3u);
  // Tags with attributes or odd names err on the deep side.
  EXPECT_EQ(depth("<array a=\"1\"><arrayish><dict\t>"), 3u);
}

TEST(VSAPlist, NULInXMLTextIsRefusedNotFatal) {
  // libplist asserts that a string or key has no NUL in it; such text must
  // never reach it (found by fuzzing).
  VSAErrorRef error;
  for (const char* tag : {"string", "key"}) {
    std::string xml = std::string("<plist version=\"1.0\"><dict><key>k</key><") + tag + ">ab" +
                      std::string(3, '\0') + "cd</" + tag + "></dict></plist>";
    EXPECT_FALSE(VSAPlist::parse(bytesOf(xml), &error)) << tag;
  }
  std::string cdata =
      std::string("<plist version=\"1.0\"><string><![CDATA[x") + '\0' + "y]]></string></plist>";
  EXPECT_FALSE(VSAPlist::parse(bytesOf(cdata), &error));
  // A character reference to NUL is refused by libplist itself.
  std::string entity =
      "<plist version=\"1.0\"><dict><key>a&#0;b</key><string>a&#0;b</string>"
      "</dict></plist>";
  EXPECT_FALSE(VSAPlist::parse(bytesOf(entity), &error));
}

TEST(VSAPlist, OversizedXMLIsRefusedUnread) {
  std::string xml = "<plist version=\"1.0\"><string>" +
                    std::string(kVSAMaxXMLPropertyListSize, 'a') + "</string></plist>";
  VSAErrorRef error;
  EXPECT_FALSE(VSAPlist::parse(bytesOf(xml), &error));
  ASSERT_TRUE(error);
  EXPECT_NE(error->message().find("XML property list too large"), std::string::npos)
      << error->message();
}

TEST(VSAPlist, BinaryOnlyRefusesXML) {
  VSAValue v = VSAValue::Dictionary{{"k", VSAValue("v")}};
  VSAErrorRef error;
  auto xml = VSAPlist::serialize(v, VSAPlist::Format::XML, &error);
  auto binary = VSAPlist::serialize(v, VSAPlist::Format::Binary, &error);
  EXPECT_TRUE(VSAPlist::parse(*xml, &error));
  EXPECT_FALSE(VSAPlist::parse(*xml, &error, VSAPlist::Accept::BinaryOnly));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), kVSAPropertyListReadCorruptError);
  auto back = VSAPlist::parse(*binary, &error, VSAPlist::Accept::BinaryOnly);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, v);
}

TEST_F(VSAPlistFiles, BoundedReadRefusesWhatIsNotASmallRegularFile) {
  std::vector<uint8_t> bytes;
  std::string file = VSAPathJoin(dir_, "file");
  std::ofstream(file) << std::string(100, 'x');
  EXPECT_EQ(VSAReadRegularFile(file, 100, &bytes), 0);
  EXPECT_EQ(bytes.size(), 100u);
  EXPECT_EQ(VSAReadRegularFile(file, 99, &bytes), EFBIG);
  EXPECT_TRUE(bytes.empty());
  // A 64 GiB sparse file is refused by its size, not read.
  std::string sparse = VSAPathJoin(dir_, "sparse");
  int fd = ::open(sparse.c_str(), O_WRONLY | O_CREAT, 0644);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(ftruncate(fd, off_t{64} << 30), 0);
  ::close(fd);
  EXPECT_EQ(VSAReadRegularFile(sparse, 64 << 10, &bytes), EFBIG);
  std::string link = VSAPathJoin(dir_, "link");
  ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
  EXPECT_EQ(VSAReadRegularFile(link, 1 << 20, &bytes), ELOOP);
  EXPECT_EQ(VSAReadRegularFile(dir_, 1 << 20, &bytes), EINVAL);
  std::string fifo = VSAPathJoin(dir_, "fifo");
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0644), 0);
  EXPECT_EQ(VSAReadRegularFile(fifo, 1 << 20, &bytes), EINVAL);
  struct stat st;
  EXPECT_EQ(VSAReadRegularFile(file, 100, &bytes, &st), 0);
  EXPECT_EQ(st.st_size, 100);
}

TEST_F(VSAPlistFiles, ReadRelativeToADirectoryStaysBeneathItWithoutLinks) {
  // A tree an app owns: container/file, a link to the container, and a file
  // outside the directory that is opened.
  std::string top = VSAPathJoin(dir_, "class");
  std::filesystem::create_directories(VSAPathJoin(top, "container"));
  std::ofstream(VSAPathJoin(top, "container/file")) << "inside";
  std::ofstream(VSAPathJoin(dir_, "outside")) << "outside";
  ASSERT_EQ(::symlink("container", VSAPathJoin(top, "link").c_str()), 0);
  ASSERT_EQ(
      ::symlink(VSAPathJoin(dir_, "outside").c_str(), VSAPathJoin(top, "container/escape").c_str()),
      0);
  int dir = ::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_GE(dir, 0);
  std::vector<uint8_t> bytes;
  EXPECT_EQ(VSAReadRegularFileAt(dir, "container/file", 100, &bytes), 0);
  EXPECT_EQ(std::string(bytes.begin(), bytes.end()), "inside");
  EXPECT_EQ(VSAReadRegularFileAt(dir, "container/file", 5, &bytes), EFBIG);
  // Up and out, or from the root: refused, whatever is there.
  EXPECT_EQ(VSAReadRegularFileAt(dir, "../outside", 100, &bytes), EXDEV);
  EXPECT_EQ(VSAReadRegularFileAt(dir, "container/../../outside", 100, &bytes), EXDEV);
  EXPECT_EQ(VSAReadRegularFileAt(dir, VSAPathJoin(dir_, "outside"), 100, &bytes), EXDEV);
  // A link anywhere on the way, in the middle or at the end: refused.
  EXPECT_EQ(VSAReadRegularFileAt(dir, "link/file", 100, &bytes), ELOOP);
  EXPECT_EQ(VSAReadRegularFileAt(dir, "container/escape", 100, &bytes), ELOOP);
  EXPECT_TRUE(bytes.empty());
  ::close(dir);
}

TEST_F(VSAPlistFiles, AFIFOInPlaceOfAPropertyListDoesNotBlock) {
  std::string fifo = VSAPathJoin(dir_, "fifo.plist");
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0644), 0);
  auto read = std::async(std::launch::async, [&] {
    VSAErrorRef error;
    bool refused = !VSA_dictionaryWithContentsOfURL(fifo, 0, &error);
    return refused && error && error->code() == EINVAL;
  });
  if (read.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
    ADD_FAILURE() << "reading a FIFO blocked";
    // Give the blocked reader a writer (then end of file) so the test ends.
    int w = ::open(fifo.c_str(), O_WRONLY | O_NONBLOCK);
    if (w >= 0) ::close(w);
  }
  EXPECT_TRUE(read.get());
}

TEST_F(VSAPlistFiles, WriteIsAtomicAndReadsBack) {
  // Durable writes rename over the old file; run-time state swaps names
  // with it and drops it. Either way: the new content whole, nothing beside.
  for (uint64_t options : {kVSAWriteFileProtectionNone, kVSAWriteFileWithoutSync}) {
    SCOPED_TRACE(options);
    std::filesystem::remove_all(dir_);
    std::filesystem::create_directories(dir_);
    std::string path = VSAPathJoin(dir_, "a.plist");
    VSAValue v = VSAValue::Dictionary{{"k", VSAValue("v1")}};
    VSAErrorRef error;
    ASSERT_TRUE(VSA_writeToURL(v, path, options, &error));
    // A reader that opened the old file keeps reading the old content.
    int reader = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    ASSERT_GE(reader, 0);
    for (const char* next : {"v2", "v3"}) {
      v.set("k", VSAValue(next));
      ASSERT_TRUE(VSA_writeToURL(v, path, options, &error));
    }
    auto back = VSA_dictionaryWithContentsOfURL(path, 0, &error);
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, v);
    std::vector<uint8_t> old(4096);
    ssize_t n = ::pread(reader, old.data(), old.size(), 0);
    ::close(reader);
    ASSERT_GT(n, 0);
    auto first = VSAPlist::parse(old.data(), static_cast<size_t>(n), &error);
    ASSERT_TRUE(first);
    EXPECT_EQ(*first->get("k")->stringValue(), "v1");
    int entries = 0;
    for (auto& e : std::filesystem::directory_iterator(dir_)) (void)e, ++entries;
    EXPECT_EQ(entries, 1);
    // A directory in the file's place is refused, not swapped away.
    std::string taken = VSAPathJoin(dir_, "taken");
    std::filesystem::create_directories(taken + "/inside");
    EXPECT_FALSE(VSA_writeToURL(v, taken, options, &error));
    EXPECT_TRUE(std::filesystem::is_directory(taken + "/inside"));
    entries = 0;
    for (auto& e : std::filesystem::directory_iterator(dir_)) (void)e, ++entries;
    EXPECT_EQ(entries, 2);
  }
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
  // A link on the way to the directory is not followed: nothing lands behind it.
  std::filesystem::create_directories(VSAPathJoin(dir_, "real"));
  std::filesystem::create_directory_symlink("real", VSAPathJoin(dir_, "link"));
  EXPECT_FALSE(
      VSA_writeToURL(v, VSAPathJoin(dir_, "link/x.plist"), kVSAWriteFileWithoutSync, &error));
  EXPECT_EQ(error->code(), ELOOP);
  EXPECT_TRUE(std::filesystem::is_empty(VSAPathJoin(dir_, "real")));
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
