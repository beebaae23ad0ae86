#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "base/VSAPlist.h"
#include "codesigning/VSAWhitelist.h"

namespace {

TEST(VSAWhitelist, BuiltInTablesFollowTheLookupRules) {
  auto w = VSAWhitelist::load("/nonexistent/whitelist.plist", false);
  // A client allowed everything: every class below 14, nothing above.
  EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier("com.tamsk.backupd",
                                                           VSAClass::kDataApplication, "any.app"));
  EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier("com.tamsk.backupd",
                                                           VSAClass::kSystemGroup, "x"));
  EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("com.tamsk.backupd", 14, "x"));
  // The class-10 identifier is open to every client, in class 10 only.
  EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier(
      "com.nobody", VSAClass::kDataInternalDaemon, "com.tamsk.diagnosticd"));
  EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier(
      "com.nobody", VSAClass::kDataApplication, "com.tamsk.diagnosticd"));
  // A client with one class and one identifier.
  EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier(
      "com.tamsk.homescreen", VSAClass::kAppGroup, "group.com.tamsk.widgets"));
  EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("com.tamsk.homescreen",
                                                            VSAClass::kAppGroup, "group.other"));
  EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier(
      "com.tamsk.homescreen", VSAClass::kDataApplication, "group.com.tamsk.widgets"));
  EXPECT_EQ(w->wellknownSystemContainers().size(), 2u);
  EXPECT_EQ(w->wellknownSystemGroupContainers().size(), 8u);
  for (const auto& g : w->wellknownSystemGroupContainers())
    EXPECT_EQ(g.rfind("systemgroup.", 0), 0u);
  EXPECT_EQ(VSAWhitelist::load("/nonexistent", true)->wellknownSystemGroupContainers().size(), 9u)
      << "internal builds know one more";
  EXPECT_EQ(w->wellknownContainerForId("com.tamsk.lockdownd", VSAClass::kSystemData),
            "com.tamsk.lockdownd");
  EXPECT_FALSE(w->wellknownContainerForId("com.tamsk.lockdownd", VSAClass::kSystemGroup));
  EXPECT_FALSE(w->containerIdIsWellknown("com.tamsk.lockdownd", VSAClass::kDataApplication));
}

TEST(VSAWhitelist, AnIntegratorSuppliesTheTables) {
  char tmpl[] = "/tmp/vessa-wl-XXXXXX";
  std::string dir = mkdtemp(tmpl);
  std::string path = dir + "/whitelist.plist";
  VSAValue tables = VSAValue::Dictionary{
      {"SystemContainers", VSAValue::Array{VSAValue("com.vendor.service")}},
      {"Clients",
       VSAValue::Dictionary{
           {"com.vendor.tool",
            VSAValue::Dictionary{{std::to_string(VSAClass::kDataApplication), VSAValue("*")},
                                 {"bad", VSAValue(1)}}}}}};
  ASSERT_TRUE(VSA_writeToURL(tables, path, 0, nullptr));
  auto w = VSAWhitelist::load(path, false);
  EXPECT_TRUE(w->systemContainerIdIsWellknown("com.vendor.service"));
  EXPECT_FALSE(w->systemContainerIdIsWellknown("com.tamsk.lockdownd"));
  EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier("com.vendor.tool",
                                                           VSAClass::kDataApplication, "anything"));
  EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("com.vendor.tool", VSAClass::kAppGroup,
                                                            "anything"));
  std::ofstream(path) << "garbage";
  EXPECT_TRUE(VSAWhitelist::load(path, false)->systemContainerIdIsWellknown("com.tamsk.lockdownd"))
      << "an unreadable file falls back to the built-in tables";
  std::filesystem::remove_all(dir);
}

}  // namespace
