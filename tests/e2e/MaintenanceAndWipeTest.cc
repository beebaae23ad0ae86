// End to end: info values, default structure, directory UUID, replace and
// wipe through the real daemon, and a daemon killed inside a wipe.
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <random>
#include <thread>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "e2e/VSATestDaemon.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace {

const char* kAllowed = "com.tamsk.private.Vessa.allowed";

VSAValue request(VSACommandNumber command, const char* id,
                 VSAContainerClass containerClass = VSAClass::kDataApplication) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)},
                              {"Identifier", VSAValue(id)},
                              {"ContainerClass", VSAValue(containerClass)}};
}

VSAValue with(VSAValue body, const char* key, VSAValue value) {
  body.set(key, std::move(value));
  return body;
}

struct Container {
  std::string path;
  VSAUUID uuid;
};

std::optional<Container> lookup(VSATestDaemon& d, const char* id, bool create = false,
                                VSAContainerClass containerClass = VSAClass::kDataApplication) {
  auto reply = d.request(
      with(request(VSACommands::kCreateOrLookup, id, containerClass), "CreateIfNecessary", create));
  if (VSAReplyError(reply) != 1) return std::nullopt;
  return Container{VSAReplyString(reply, "ReplyPath"), *reply->get("ReplyUUID")->uuidValue()};
}

size_t entries(const std::string& dir) {
  if (!fs::exists(dir)) return 0;
  return static_cast<size_t>(std::distance(fs::directory_iterator(dir), {}));
}

TEST(DaemonMaintenance, InfoValuesStructureUUIDReplaceAndWipeThroughTheSocket) {
  VSATestDaemon d;
  d.registerSelf(
      "com.example.installer",
      VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                           {"com.tamsk.private.Vessa.deleteContainerContent", VSAValue(true)},
                           {"com.tamsk.private.Vessa.wipeContainer",
                            VSAValue(VSAValue::Array{VSAValue("com.example.plugin")})}});
  ASSERT_TRUE(d.start());
  auto app = lookup(d, "com.example.app", true);
  ASSERT_TRUE(app);

  // Info values: set, read, unset key, bad key, removal.
  EXPECT_EQ(
      VSAReplyError(d.request(with(
          with(request(VSACommands::kSetInfoValue, "com.example.app"), "Key", VSAValue("color")),
          "Value", VSAValue("blue")))),
      1u);
  auto value = d.request(
      with(request(VSACommands::kInfoValue, "com.example.app"), "Key", VSAValue("color")));
  EXPECT_EQ(VSAReplyString(value, "ReplyInfoValue"), "blue");
  EXPECT_EQ(VSAReplyError(d.request(with(request(VSACommands::kInfoValue, "com.example.app"), "Key",
                                         VSAValue("size")))),
            24u);
  EXPECT_EQ(VSAReplyError(d.request(with(request(VSACommands::kInfoValue, "com.example.app"), "Key",
                                         VSAValue(int64_t{3})))),
            38u);
  EXPECT_EQ(VSAReplyError(d.request(with(request(VSACommands::kSetInfoValue, "com.example.app"),
                                         "Key", VSAValue("color")))),
            1u);
  EXPECT_EQ(VSAReplyError(d.request(with(request(VSACommands::kInfoValue, "com.example.app"), "Key",
                                         VSAValue("color")))),
            24u);

  // Both commands make missing default sub-directories again.
  for (VSACommandNumber command :
       {VSACommands::kRecreateDefaultStructure, VSACommands::kRestoreDefaultStructure}) {
    fs::remove_all(app->path + "/Library/Caches");
    EXPECT_EQ(VSAReplyError(d.request(request(command, "com.example.app"))), 1u) << command;
    EXPECT_TRUE(fs::is_directory(app->path + "/Library/Caches")) << command;
  }

  // Disk usage: the bytes it takes.
  std::ofstream(app->path + "/Documents/blob") << std::string(50000, 'x');
  auto usage = d.request(request(VSACommands::kDiskUsage, "com.example.app"));
  ASSERT_EQ(VSAReplyError(usage), 1u);
  EXPECT_GE(usage->get("ReplyDiskUsage")->uint64Value().value_or(0), 50000u);
  fs::remove(app->path + "/Documents/blob");

  // A new directory name, the same identity.
  EXPECT_EQ(
      VSAReplyError(d.request(request(VSACommands::kRegenerateDirectoryUUID, "com.example.app"))),
      1u);
  auto renamed = lookup(d, "com.example.app");
  ASSERT_TRUE(renamed);
  EXPECT_NE(renamed->path, app->path);
  EXPECT_EQ(renamed->uuid, app->uuid);
  EXPECT_FALSE(fs::exists(app->path));

  // Deleting the content: the content goes, path and UUID stay.
  std::ofstream(renamed->path + "/Documents/diary") << "secret";
  EXPECT_EQ(
      VSAReplyError(d.request(request(VSACommands::kDeleteContainerContent, "com.example.app"))),
      1u);
  auto wiped = lookup(d, "com.example.app");
  ASSERT_TRUE(wiped);
  EXPECT_EQ(wiped->path, renamed->path);
  EXPECT_EQ(wiped->uuid, app->uuid);
  EXPECT_FALSE(fs::exists(renamed->path + "/Documents/diary"));
  EXPECT_TRUE(fs::is_directory(renamed->path + "/Documents"));

  // Wiping plug-in data: the class is fixed to plug-in data.
  auto plugin = lookup(d, "com.example.plugin", true, VSAClass::kDataPlugin);
  ASSERT_TRUE(plugin);
  std::ofstream(plugin->path + "/Documents/cache") << "x";
  VSAValue wipePlugin = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kWipePluginData)},
                                             {"Identifier", VSAValue("com.example.plugin")}};
  EXPECT_EQ(VSAReplyError(d.request(wipePlugin)), 1u);
  EXPECT_FALSE(fs::exists(plugin->path + "/Documents/cache"));

  // Replace: b takes a's place under its own UUID; a is gone.
  auto a = lookup(d, "com.example.a", true);
  auto b = lookup(d, "com.example.b", true);
  ASSERT_TRUE(a && b);
  VSAValue replace =
      VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReplaceContainer)},
                           {"OldIdentifier", VSAValue("com.example.a")},
                           {"OldContainerClass", VSAValue(VSAClass::kDataApplication)},
                           {"OldContainerUUID", VSAValue(a->uuid)},
                           {"NewIdentifier", VSAValue("com.example.b")},
                           {"NewContainerClass", VSAValue(VSAClass::kDataApplication)},
                           {"NewContainerUUID", VSAValue(b->uuid)}};
  EXPECT_EQ(VSAReplyError(d.request(replace)), 1u);
  EXPECT_FALSE(lookup(d, "com.example.a"));
  auto moved = lookup(d, "com.example.b");
  ASSERT_TRUE(moved);
  EXPECT_EQ(fs::path(moved->path).filename().string(), b->uuid.string());
  EXPECT_EQ(VSAReplyError(d.request(replace)), 21u);  // a no longer exists
  EXPECT_EQ(d.stop(), 0);
}

// SIGKILL lands at random moments of a stream of wipes until one lands
// inside a replace (its journal is on disk); every restart must find the
// container whole at its path with its UUID, and no journal left.
TEST(DaemonCrash, KilledInsideAWipeRestartsWithTheContainerWhole) {
  VSATestDaemon d;
  d.registerSelf(
      "com.example.installer",
      VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                           {"com.tamsk.private.Vessa.deleteContainerContent", VSAValue(true)}});
  ASSERT_TRUE(d.start());
  auto app = lookup(d, "com.example.app", true);
  ASSERT_TRUE(app);
  const std::string journals = d.path("/private/var/root/Library/Vessa/Replace");
  const std::string classDir = fs::path(app->path).parent_path().string();
  std::mt19937 random(42);
  int killsInsideAReplace = 0, kills = 0;
  while (killsInsideAReplace == 0 && kills < 60) {
    std::atomic<bool> stop{false};
    std::thread wiper([&] {
      while (!stop &&
             VSAReplyError(d.request(
                 request(VSACommands::kDeleteContainerContent, "com.example.app"), 2s)) == 1) {
      }
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(5 + random() % 60));
    d.crash();
    ++kills;
    stop = true;
    wiper.join();
    if (entries(journals) > 0) ++killsInsideAReplace;
    ASSERT_TRUE(d.start());
    auto found = lookup(d, "com.example.app");
    ASSERT_TRUE(found) << "after kill " << kills;
    EXPECT_EQ(found->path, app->path);
    EXPECT_EQ(found->uuid, app->uuid);
    EXPECT_EQ(entries(journals), 0u);
    EXPECT_EQ(entries(classDir), 1u);
    if (::testing::Test::HasFailure()) break;
  }
  std::printf("%d kills, %d inside a replace\n", kills, killsInsideAReplace);
  EXPECT_GT(killsInsideAReplace, 0);
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
