// End to end: a device left by an earlier release is upgraded by the real
// daemon at its first start after a boot, then the client-requested
// migrations (24, 30) finish the work; later starts find nothing to do.
// What the mobile user planted in the old bundle location stays there, and a
// pass that cannot store a legacy source removes no group that it names.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "base/VSAPlist.h"
#include "base/VSAUUID.h"
#include "e2e/VSATestDaemon.h"
#include "e2e/VSATestDatabase.h"

namespace fs = std::filesystem;

namespace {

VSAValue body(VSACommandNumber command) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)}};
}

VSAValue withContainer(VSACommandNumber command, const char* id, VSAContainerClass containerClass) {
  VSAValue v = body(command);
  v.set("Identifier", VSAValue(id));
  v.set("ContainerClass", VSAValue(containerClass));
  return v;
}

void writeVersion(VSATestDaemon& d, const char* build, const char* release = "User") {
  VSA_writeToURL(
      VSAValue::Dictionary{{"BuildVersion", VSAValue(build)}, {"ReleaseType", VSAValue(release)}},
      d.path("/etc/vessad/system-version.plist"), 0, nullptr);
}

size_t count(const std::string& text, const std::string& needle) {
  size_t n = 0;
  for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) ++n;
  return n;
}

// The build is the system-version file's "BuildVersion": boots of the same
// build leave system containers where they are, a new one gives them new
// directory names, and a new "ReleaseType" alone is no upgrade.
TEST(DaemonUpgrade, OnlyANewBuildVersionIsAnUpgrade) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
  writeVersion(d, "1A100");
  ASSERT_TRUE(d.start());
  VSAValue create = withContainer(VSACommands::kCreateOrLookup, "com.example.systemservice",
                                  VSAClass::kSystemData);
  create.set("CreateIfNecessary", VSAValue(true));
  auto made = d.request(create);
  ASSERT_EQ(VSAReplyError(made), 1u);
  EXPECT_EQ(d.stop(), 0);
  auto pathAfterBoot = [&](const char* build, const char* release) {
    writeVersion(d, build, release);
    EXPECT_TRUE(d.start(true, {"--after-boot"}));
    std::string path =
        VSAReplyString(d.request(withContainer(VSACommands::kCreateOrLookup,
                                               "com.example.systemservice", VSAClass::kSystemData)),
                       "ReplyPath");
    EXPECT_EQ(d.stop(), 0);
    return path;
  };
  std::string first = VSAReplyString(made, "ReplyPath");
  ASSERT_FALSE(first.empty());
  EXPECT_EQ(pathAfterBoot("1A100", "User"), first) << "the same build is no upgrade";
  EXPECT_EQ(pathAfterBoot("1A100", "Internal"), first) << "a release type alone is no upgrade";
  std::string upgraded = pathAfterBoot("1A200", "Internal");
  EXPECT_FALSE(upgraded.empty());
  EXPECT_NE(upgraded, first) << "a new build rolls system container directory names";
  EXPECT_TRUE(fs::is_directory(upgraded));
  EXPECT_NE(d.daemonOutput().find("Detected upgrade from 1A100 (User) to 1A200 (Internal)"),
            std::string::npos);
}

TEST(DaemonUpgrade, AnOldDeviceIsUpgradedAtBootAndByTheMigrationCommands) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)},
                                      {"com.tamsk.private.Vessa.dataMigration", VSAValue(true)}});
  writeVersion(d, "OLD1");
  ASSERT_TRUE(d.start());
  // The old release kept code-signing info in the bundle's metadata.
  VSAValue create =
      withContainer(VSACommands::kCreateOrLookup, "com.example.old", VSAClass::kBundleApplication);
  create.set("CreateIfNecessary", VSAValue(true));
  ASSERT_EQ(VSAReplyError(d.request(create)), 1u);
  VSAValue setInfo =
      withContainer(VSACommands::kSetInfoValue, "com.example.old", VSAClass::kBundleApplication);
  setInfo.set("Key", VSAValue("com.tamsk.Ferrox.CachedCodeSigningInfo"));
  setInfo.set("Value", VSAValue(VSAValue::Dictionary{
                           {"Entitlements", VSAValue::Dictionary{{"old", VSAValue(true)}}}}));
  ASSERT_EQ(VSAReplyError(d.request(setInfo)), 1u);
  EXPECT_EQ(d.stop(), 0);
  std::string library = d.path("/private/var/root/Library/Vessa");
  VSA_writeToURL(VSAValue::Dictionary{{"com.example.legacy",
                                       VSAValue::Dictionary{{"legacy", VSAValue(true)}}}},
                 library + "/vsa_entitlements.plist", 0, nullptr);
  fs::create_directories(d.path("/private/var/mobile/Library/Logs/Vessa"));
  std::ofstream(d.path("/private/var/mobile/Library/Logs/Vessa/vessad.log")) << "old";

  writeVersion(d, "NEW2");
  ASSERT_TRUE(d.start(true, {"--after-boot"}));
  EXPECT_NE(d.daemonOutput().find("Detected upgrade from OLD1 (User) to NEW2 (User)"),
            std::string::npos);
  EXPECT_TRUE(fs::exists(d.path("/private/var/root/Library/Logs/Vessa/vessad.0")));
  EXPECT_EQ(VSAReplyError(d.request(body(VSACommands::kDataMigration))), 1u);
  EXPECT_FALSE(fs::exists(library + "/vsa_entitlements.plist"));
  VSAValue read = body(VSACommands::kReadCodeSigningInfo);
  read.set("Identifier", VSAValue("com.example.old"));
  auto info = d.request(read);
  ASSERT_EQ(VSAReplyError(info), 1u);
  ASSERT_TRUE(info->get("ReplyInfoDictionary"));
  EXPECT_TRUE(info->get("ReplyInfoDictionary")->get("com.tamsk.Vessa.Entitlements"));
  EXPECT_EQ(VSAReplyError(d.request(body(VSACommands::kPerUserDataMigration))), 1u);
  EXPECT_EQ(d.stop(), 0);

  // Same build at the next boot: no upgrade, and 24 finds every type recorded.
  ASSERT_TRUE(d.start(true, {"--after-boot"}));
  EXPECT_EQ(count(d.daemonOutput(), "skipping upgrade"), 1u);
  EXPECT_EQ(VSAReplyError(d.request(body(VSACommands::kDataMigration))), 1u);
  EXPECT_EQ(count(d.daemonOutput(), "Performing code signing migration"), 1u);
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonUpgrade, ABundleTheUserPlantedInTheOldLocationIsLeftThere) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
  writeVersion(d, "OLD1");
  ASSERT_TRUE(d.start());
  EXPECT_EQ(d.stop(), 0);
  // The old bundle location lies in the mobile user's Containers directory:
  // the user makes a bundle container there, with a metadata file of its own.
  std::string containers = d.path("/private/var/mobile/Containers");
  fs::create_directories(containers);
  ASSERT_EQ(chown(containers.c_str(), 501, 501), 0);
  fs::permissions(d.root(), fs::perms(0755));
  std::string uuid = VSAUUID::random().string();
  std::string planted = containers + "/Bundle/Application/" + uuid;
  auto forged = VSAPlist::serialize(
      VSAValue::Dictionary{{"VSAMetadataIdentifier", VSAValue("com.example.victim")},
                           {"VSAMetadataUUID", VSAValue(VSAUUID::random().string())},
                           {"VSAMetadataContentClass", VSAValue(VSAClass::kBundleApplication)},
                           {"VSAMetadataVersion", VSAValue("2")}},
      VSAPlist::Format::Binary, nullptr);
  ASSERT_TRUE(forged);
  std::string metadata = planted + "/.com.tamsk.vessa_keeper.metadata.plist";
  ASSERT_EQ(VSARunAsMobileUser([&] {
              for (const std::string& dir :
                   {containers + "/Bundle", containers + "/Bundle/Application", planted})
                if (mkdir(dir.c_str(), 0755) != 0) return 1;
              int fd = open(metadata.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
              bool whole = fd >= 0 && write(fd, forged->data(), forged->size()) ==
                                          static_cast<ssize_t>(forged->size());
              return whole && close(fd) == 0 ? 0 : 1;
            }).status,
            0);

  writeVersion(d, "NEW2");
  ASSERT_TRUE(d.start(true, {"--after-boot"}));
  EXPECT_NE(d.daemonOutput().find("Detected upgrade from OLD1"), std::string::npos);
  auto victim = d.request(withContainer(VSACommands::kCreateOrLookup, "com.example.victim",
                                        VSAClass::kBundleApplication));
  EXPECT_EQ(VSAReplyError(victim), 21u) << VSAReplyString(victim, "ReplyPath");
  EXPECT_FALSE(fs::exists(d.path("/private/var/containers/Bundle/Application/" + uuid)));
  EXPECT_TRUE(fs::exists(metadata));
  EXPECT_NE(d.daemonOutput().find("Leaving " + containers + "/Bundle"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

// The group ID migration cannot store what a data container's metadata says
// about its groups (the database refuses that identifier's entry): the value
// stays for the next pass, and so does the group container that only it
// names. The next pass that completes keeps the group, now referenced.
TEST(DaemonUpgrade, APassThatKeepsASourceForItsRetryRemovesNoGroupThatSourceNames) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer",
                 VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)},
                                      {"com.tamsk.private.Vessa.dataMigration", VSAValue(true)}});
  writeVersion(d, "OLD1");
  ASSERT_TRUE(d.start());
  for (auto [id, containerClass] : {std::pair<const char*, VSAContainerClass>{
                                        "com.example.grouped", VSAClass::kDataApplication},
                                    {"group.example.legacy", VSAClass::kAppGroup}}) {
    VSAValue create = withContainer(VSACommands::kCreateOrLookup, id, containerClass);
    create.set("CreateIfNecessary", VSAValue(true));
    ASSERT_EQ(VSAReplyError(d.request(create)), 1u) << id;
  }
  VSAValue lookup =
      withContainer(VSACommands::kCreateOrLookup, "group.example.legacy", VSAClass::kAppGroup);
  std::string group = VSAReplyString(d.request(lookup), "ReplyPath");
  VSAValue setInfo =
      withContainer(VSACommands::kSetInfoValue, "com.example.grouped", VSAClass::kDataApplication);
  setInfo.set("Key", VSAValue("com.tamsk.Ferrox.GroupContainerIDs"));
  setInfo.set("Value", VSAValue(VSAValue::Array{VSAValue("group.example.legacy")}));
  ASSERT_EQ(VSAReplyError(d.request(setInfo)), 1u);
  EXPECT_EQ(d.stop(), 0);

  ASSERT_EQ(VSARefuseEntryWrites(d, "com.example.grouped", true), "");
  writeVersion(d, "NEW2");
  ASSERT_TRUE(d.start(true, {"--after-boot"}));
  EXPECT_NE(VSAReplyError(d.request(body(VSACommands::kDataMigration))), 1u);
  EXPECT_TRUE(fs::exists(group + "/.com.tamsk.vessa_keeper.metadata.plist"));
  EXPECT_NE(d.daemonOutput().find("Not reconciling application groups"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);

  ASSERT_EQ(VSARefuseEntryWrites(d, "com.example.grouped", false), "");
  ASSERT_TRUE(d.start());
  EXPECT_EQ(VSAReplyError(d.request(body(VSACommands::kDataMigration))), 1u);
  EXPECT_TRUE(fs::exists(group + "/.com.tamsk.vessa_keeper.metadata.plist"));
  EXPECT_EQ(VSAReplyString(d.request(lookup), "ReplyPath"), group);
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
