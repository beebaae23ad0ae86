#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "VSATestTempDir.h"
#include "codesigning/VSASQLiteDB.h"

namespace {

class CodeSigningDB : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = temp_.path();
    db_ = std::make_unique<VSASQLiteDB>(dir_);
  }
  void TearDown() override {
    db_.reset();
    std::filesystem::remove_all(dir_);
  }
  static VSACodeSigningEntry entry(const char* team, std::vector<std::string> children = {}) {
    VSACodeSigningEntry e(VSAValue::Dictionary{{"TeamIdentifier", VSAValue(team)}},
                          VSAClass::kDataApplication);
    if (!children.empty()) e.setChildBundleIdentifiers(children);
    return e;
  }
  bool add(const VSACodeSigningEntry& e, const std::string& id) {
    VSAErrorRef error;
    bool ok = db_->addCodeSigningEntry(&e, &id, &error);
    EXPECT_TRUE(ok) << (error ? error->description() : "");
    return ok;
  }
  VSATestTempDir temp_{"vessa-db"};
  std::string dir_;
  std::unique_ptr<VSASQLiteDB> db_;
};

TEST(VSACodeSigningEntry, SerialisationEqualityAndHash) {
  VSACodeSigningEntry a(VSAValue::Dictionary{{"k", VSAValue(1)}}, VSAClass::kUndefined);
  a.setChildBundleIdentifiers(std::vector<std::string>{"x", "y"});
  a.setAdvanceCopy(true);
  VSACodeSigningEntry back = VSACodeSigningEntry::initWithSerializedDictionary(a.serialize());
  EXPECT_TRUE(back.isEqual(a));
  VSACodeSigningEntry reordered = a;
  reordered.setChildBundleIdentifiers(std::vector<std::string>{"y", "x"});
  EXPECT_FALSE(reordered.isEqual(a)) << "child order matters";
  VSACodeSigningEntry classed = a;
  classed.setDataContainerClass(VSAClass::kAppGroup);
  EXPECT_EQ(classed.hash(), a.hash() + 16);
  classed.setDataContainerClass(VSAClass::kDataApplication);
  EXPECT_EQ(classed.hash(), a.hash() + 16) << "whatever the class's value";
  EXPECT_NE(a.description().find("advanceCopy: Y"), std::string::npos);
  VSACodeSigningEntry empty =
      VSACodeSigningEntry::initWithSerializedDictionary(VSAValue::dictionary());
  EXPECT_FALSE(empty.isInvalid() || empty.isPlaceholder() || empty.childBundleIdentifiers());
}

TEST_F(CodeSigningDB, UpdateThenInsertAndReplace) {
  ASSERT_TRUE(add(entry("A", {"com.p.child1", "com.p.child2"}), "com.p"));
  VSAErrorRef error;
  auto got = db_->codeSigningEntryWithIdentifier("com.p", &error);
  ASSERT_TRUE(got);
  EXPECT_EQ(*got->codeSigningInfo().get("TeamIdentifier")->stringValue(), "A");
  EXPECT_EQ(got->dataContainerClass(), VSAClass::kDataApplication);
  EXPECT_EQ(got->childBundleIdentifiers()->size(), 2u);
  // Re-adding replaces blob and flags but keeps child links it no longer lists.
  auto second = entry("B", {"com.p.child1"});
  second.setInvalid(true);
  ASSERT_TRUE(add(second, "com.p"));
  got = db_->codeSigningEntryWithIdentifier("com.p", &error);
  EXPECT_EQ(*got->codeSigningInfo().get("TeamIdentifier")->stringValue(), "B");
  EXPECT_TRUE(got->isInvalid());
  EXPECT_EQ(got->childBundleIdentifiers()->size(), 2u);
  EXPECT_EQ(*db_->parentIdentifierForChildIdentifier("com.p.child2", &error), "com.p");
  EXPECT_EQ(db_->identifiersWithError(&error)->size(), 1u);
}

TEST_F(CodeSigningDB, NotFoundAndNoChildren) {
  VSAErrorRef error;
  EXPECT_FALSE(db_->codeSigningEntryWithIdentifier("none", &error));
  EXPECT_EQ(error->code(), 67);
  EXPECT_EQ(error->message(), "Identifier: \"none\" Not Found in DB");
  ASSERT_TRUE(add(entry("A"), "com.lonely"));
  auto got = db_->codeSigningEntryWithIdentifier("com.lonely", &error);
  ASSERT_TRUE(got);
  EXPECT_FALSE(got->childBundleIdentifiers()) << "no children: not set, not an error";
  EXPECT_FALSE(db_->parentIdentifierForChildIdentifier("com.lonely", &error));
  EXPECT_EQ(error->code(), 67);
}

// The class alone, as launches ask for it, answers as the whole entry does.
TEST_F(CodeSigningDB, ClassAloneAgreesWithTheEntry) {
  VSAErrorRef error;
  EXPECT_FALSE(db_->dataContainerClassWithIdentifier("none", &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), 67);
  EXPECT_TRUE(VSASQLiteDB::isNotFound(error));
  ASSERT_TRUE(add(entry("A", {"com.p.child"}), "com.p"));
  EXPECT_EQ(db_->dataContainerClassWithIdentifier("com.p", &error), VSAClass::kDataApplication);
  auto plugin = entry("A");
  plugin.setDataContainerClass(VSAClass::kDataPlugin);
  ASSERT_TRUE(add(plugin, "com.p"));
  EXPECT_EQ(db_->dataContainerClassWithIdentifier("com.p", &error), VSAClass::kDataPlugin);
  EXPECT_EQ(db_->codeSigningEntryWithIdentifier("com.p", &error)->dataContainerClass(),
            VSAClass::kDataPlugin);
  EXPECT_FALSE(db_->dataContainerClassWithIdentifier("com.p.child", &error))
      << "a child link is not an entry of its own";
  std::string id = "com.p";
  ASSERT_TRUE(db_->deleteCodeSigningEntryWithIdentifier(&id, &error));
  EXPECT_FALSE(db_->dataContainerClassWithIdentifier("com.p", &error));
  EXPECT_TRUE(VSASQLiteDB::isNotFound(error));
}

TEST_F(CodeSigningDB, DeletingAParentCascadesLinksNotChildren) {
  ASSERT_TRUE(add(entry("A", {"com.p.child"}), "com.p"));
  ASSERT_TRUE(add(entry("C"), "com.p.child"));
  VSAErrorRef error;
  std::string parent = "com.p";
  ASSERT_TRUE(db_->deleteCodeSigningEntryWithIdentifier(&parent, &error));
  EXPECT_FALSE(db_->parentIdentifierForChildIdentifier("com.p.child", &error));
  EXPECT_TRUE(db_->codeSigningEntryWithIdentifier("com.p.child", &error));
  std::string unknown = "com.unknown";
  EXPECT_FALSE(db_->deleteCodeSigningEntryWithIdentifier(&unknown, &error));
  EXPECT_EQ(error->code(), 68);
  EXPECT_TRUE(db_->invalidateCodeSigningWithIdentifier("com.unknown", &error))
      << "invalidating an unknown identifier succeeds";
  EXPECT_FALSE(db_->deleteCodeSigningEntryWithIdentifier(nullptr, &error));
  EXPECT_EQ(error->code(), 38);
  EXPECT_EQ(error->message()[0], '\b');
}

TEST_F(CodeSigningDB, AdvanceCopiesArePurgedByTheirBit) {
  auto advance = entry("A");
  advance.setAdvanceCopy(true);
  auto placeholder = entry("B");
  placeholder.setPlaceholder(true);
  ASSERT_TRUE(add(advance, "com.advance"));
  ASSERT_TRUE(add(placeholder, "com.placeholder"));
  VSAErrorRef error;
  ASSERT_TRUE(db_->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(&error));
  EXPECT_FALSE(db_->codeSigningEntryWithIdentifier("com.advance", &error));
  auto kept = db_->codeSigningEntryWithIdentifier("com.placeholder", &error);
  ASSERT_TRUE(kept);
  EXPECT_TRUE(kept->isPlaceholder());
  EXPECT_FALSE(kept->isAdvanceCopy());
}

TEST_F(CodeSigningDB, InvalidateWithChildrenAndEnumerate) {
  ASSERT_TRUE(add(entry("A", {"com.p.c1", "com.p.c2"}), "com.p"));
  ASSERT_TRUE(add(entry("C"), "com.p.c1"));
  ASSERT_TRUE(add(entry("D"), "com.p.c2"));
  ASSERT_TRUE(add(entry("Q'uote\"d"), "odd 'id\" ;--"));
  VSAErrorRef error;
  ASSERT_TRUE(db_->invalidateCodeSigningForIdentifierAndAllChildren("com.p", &error));
  int seen = 0, invalid = 0;
  EXPECT_FALSE(db_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& id, const VSACodeSigningEntry& e) {
        ++seen;
        invalid += e.isInvalid();
        if (id == "com.p") {
          EXPECT_EQ(e.childBundleIdentifiers()->size(), 2u);
        }
      }));
  EXPECT_EQ(seen, 4);
  EXPECT_EQ(invalid, 3);
  EXPECT_TRUE(db_->codeSigningEntryWithIdentifier("odd 'id\" ;--", &error))
      << "identifiers are bound, not spliced";
}

TEST_F(CodeSigningDB, ReopeningKeepsTheRows) {
  ASSERT_TRUE(add(entry("A"), "com.keep"));
  db_.reset();
  db_ = std::make_unique<VSASQLiteDB>(dir_);
  VSAErrorRef error;
  EXPECT_TRUE(db_->codeSigningEntryWithIdentifier("com.keep", &error));
}

TEST_F(CodeSigningDB, ASecondOpenerOfTheFileStopsInsteadOfSharingIt) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(VSASQLiteDB second(dir_), "Failed to (initialize|open) database, err = ");
  VSAErrorRef error;
  ASSERT_TRUE(add(entry("A"), "com.after")) << "the first opener is unaffected";
}

TEST_F(CodeSigningDB, CorruptFileStopsAtOpen) {
  db_.reset();
  std::filesystem::remove_all(dir_);
  std::filesystem::create_directories(dir_);
  FILE* f = fopen((dir_ + "/containers.sqlite3").c_str(), "wb");
  fputs("this is not a database, but it is long enough to look like a header................", f);
  fclose(f);
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(VSASQLiteDB broken(dir_), "Failed to initialize database, err = ");
}

}  // namespace

// Statements are kept between calls: one used again while it is still
// stepping (a block that re-enters the database) gets its own copy, and a
// read abandoned mid-way or a failed write leaves nothing bound or pending.
TEST_F(CodeSigningDB, KeptStatementsSurviveReentryAndFailures) {
  ASSERT_TRUE(add(entry("A", {"com.p.c"}), "com.p"));
  ASSERT_TRUE(add(entry("B"), "com.q"));
  int outer = 0, inner = 0;
  EXPECT_FALSE(db_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string&, const VSACodeSigningEntry&) {
        ++outer;
        EXPECT_FALSE(db_->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
            [&](const std::string&, const VSACodeSigningEntry&) { ++inner; }));
      }));
  EXPECT_EQ(outer, 2);
  EXPECT_EQ(inner, 4);
  VSAErrorRef error;
  std::string unknown = "com.unknown";
  EXPECT_FALSE(db_->deleteCodeSigningEntryWithIdentifier(&unknown, &error));
  std::string known = "com.q";
  EXPECT_TRUE(db_->deleteCodeSigningEntryWithIdentifier(&known, &error))
      << "the same statement, bound afresh after a failure";
  EXPECT_FALSE(db_->codeSigningEntryWithIdentifier("com.q", &error));
  for (int i = 0; i < 100; ++i)
    ASSERT_EQ(*db_->parentIdentifierForChildIdentifier("com.p.c", &error), "com.p");
  ASSERT_TRUE(add(entry("C"), "com.r")) << "writes after many abandoned single-row reads";
  db_.reset();
  db_ = std::make_unique<VSASQLiteDB>(dir_);
  EXPECT_TRUE(db_->codeSigningEntryWithIdentifier("com.r", &error)) << "closed cleanly, reopened";
}
