// End to end: containers created, found, protected and deleted through the
// real daemon and its socket.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "base/VSAJSON.h"
#include "base/VSAPlist.h"
#include "base/VSAUUID.h"
#include "e2e/VSATestDaemon.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSALockStateService.h"
#include "platform/VSAUniqueFd.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace {

const char* kAllowed = "com.tamsk.private.Vessa.allowed";

VSAValue createRequest(const char* id, bool create = true,
                       VSAContainerClass containerClass = VSAClass::kDataApplication) {
  return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kCreateOrLookup)},
                              {"Identifier", VSAValue(id)},
                              {"ContainerClass", VSAValue(containerClass)},
                              {"CreateIfNecessary", VSAValue(create)}};
}

// Runs this test process in persona `personaID` of the daemon's root.
void enterPersona(const VSATestDaemon& d, uint32_t personaID) {
  fs::create_directories(d.path("/run/vessad/process-personas"));
  std::ofstream(d.path("/run/vessad/process-personas/" + std::to_string(getpid())))
      << VSAAuditToken::processStartTime(getpid()) << " " << personaID << "\n";
}

TEST(DaemonContainers, CreateLookUpDeleteAndEmptyDeathRow) {
  VSATestDaemon d;
  d.registerSelf(
      "com.example.installer",
      VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                           {"com.tamsk.private.Vessa.userManagedAssets", VSAValue(true)}});
  ASSERT_TRUE(d.start());
  auto created = d.request(createRequest("com.example.app"));
  ASSERT_EQ(VSAReplyError(created), 1u);
  EXPECT_FALSE(*created->get("ReplyExisted")->boolValue());
  std::string path = VSAReplyString(created, "ReplyPath");
  EXPECT_TRUE(fs::exists(path + "/.com.tamsk.vessa_keeper.metadata.plist"));
  EXPECT_TRUE(created->get("ReplyUUID")->uuidValue());
  auto found = d.request(createRequest("com.example.app", false));
  EXPECT_TRUE(*found->get("ReplyExisted")->boolValue());
  EXPECT_EQ(VSAReplyString(found, "ReplyPath"), path);
  // Metadata with and without the info dictionary.
  VSAValue meta = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kContainerMetadata)},
                                       {"Identifier", VSAValue("com.example.app")},
                                       {"ContainerClass", VSAValue(VSAClass::kDataApplication)}};
  auto plain = d.request(meta);
  EXPECT_EQ(VSAReplyString(plain, "ReplyPath"), path);
  EXPECT_FALSE(plain->get("ReplyInfoDictionary"));
  meta.set("InfoDictRequested", VSAValue(true));
  EXPECT_TRUE(d.request(meta)->get("ReplyInfoDictionary"));
  // Listing shows it.
  auto list =
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kListContainers)},
                                     {"ContainerClass", VSAValue(VSAClass::kDataApplication)}});
  ASSERT_EQ(VSAReplyError(list), 1u);
  EXPECT_EQ(list->get("ReplyIdsArray")->arrayValue()->size(), 1u);
  // Argument errors: class 14 is past the last class.
  EXPECT_EQ(VSAReplyError(d.request(createRequest("com.example.app", false, 14))), 20u);
  EXPECT_EQ(VSAReplyError(d.request(
                VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kCreateOrLookup)},
                                     {"ContainerClass", VSAValue(VSAClass::kDataApplication)}})),
            18u);
  VSAValue badPersona = createRequest("com.example.app", false);
  badPersona.set("PersonaUniqueString", VSAValue("NO-SUCH-PERSONA"));
  EXPECT_EQ(VSAReplyError(d.request(badPersona)), 76u);
  // Delete, then empty death row (command 4 replies from its completion).
  VSAValue del = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kDeleteContainer)},
                                      {"Identifier", VSAValue("com.example.app")},
                                      {"ContainerClass", VSAValue(VSAClass::kDataApplication)}};
  EXPECT_EQ(VSAReplyError(d.request(del)), 1u);
  EXPECT_FALSE(fs::exists(path));
  EXPECT_EQ(VSAReplyError(d.request(del)), 21u);
  EXPECT_EQ(VSAReplyError(d.request(
                VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kDeleteDeathRow)}})),
            1u);
  EXPECT_TRUE(fs::is_empty(d.path("/private/var/root/Library/Caches/com.tamsk.vessad/Dead")) ||
              !fs::exists(d.path("/private/var/root/Library/Caches/com.tamsk.vessad/Dead")));
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonContainers, LookupEntitlementMatrixForCommandZero) {
  VSATestDaemon d;
  d.registerVessactl("installer", "com.example.installer",
                     VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  d.registerVessactl("owner", "com.example.owner", VSAValue::dictionary());
  d.registerVessactl(
      "looker", "com.example.looker",
      VSAValue::Dictionary{{"com.tamsk.private.Vessa.lookup",
                            VSAValue::Dictionary{{"appData", VSAValue(VSAValue::Array{VSAValue(
                                                                 "com.example.owner")})}}}});
  d.registerVessactl("composer", "com.tamsk.mail.composer", VSAValue::dictionary());
  d.registerVessactl("stranger", "com.example.stranger", VSAValue::dictionary());
  ASSERT_TRUE(d.start());
  auto lookup = [&](const std::string& client, const std::string& id, bool create) {
    std::vector<std::string> args = {"Command=0", "Identifier=" + id, "ContainerClass=2"};
    if (create) args.push_back("CreateIfNecessary=true");
    return d.vessactl(client, args);
  };
  EXPECT_EQ(lookup("installer", "com.example.owner", true).status, 0);
  EXPECT_EQ(lookup("installer", "com.tamsk.mail", true).status, 0);
  EXPECT_EQ(lookup("owner", "com.example.owner", false).status, 0);   // its own
  EXPECT_EQ(lookup("looker", "com.example.owner", false).status, 0);  // lookup dictionary
  EXPECT_EQ(lookup("composer", "com.tamsk.mail", false).status, 0);   // whitelist
  auto denied = lookup("stranger", "com.example.owner", false);       // none
  EXPECT_NE(denied.status, 0);
  EXPECT_NE(denied.output.find("55"), std::string::npos) << denied.output;
  // The same answer for a container that does not exist.
  auto missing = lookup("stranger", "com.example.nothing", false);
  EXPECT_NE(missing.output.find("55"), std::string::npos) << missing.output;
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonContainers, SandboxTokensOnlyForEnterpriseContainers) {
  VSATestDaemon d;
  d.writePersonas("com.example.work");
  d.registerSelf("com.example.work", VSAValue::Dictionary{{kAllowed, VSAValue(true)}}, true);
  ASSERT_TRUE(d.start());
  auto personal = d.request(createRequest("com.example.work"));
  ASSERT_EQ(VSAReplyError(personal), 1u);
  EXPECT_FALSE(personal->get("ReplySandboxToken"));
  enterPersona(d, 1001);
  auto enterprise = d.request(createRequest("com.example.work"));
  ASSERT_EQ(VSAReplyError(enterprise), 1u);
  EXPECT_EQ(VSAReplyString(enterprise, "ReplyPersonaUniqueString"), "WORK-1001");
  EXPECT_NE(VSAReplyString(enterprise, "ReplyPath"), VSAReplyString(personal, "ReplyPath"));
  EXPECT_FALSE(VSAReplyString(enterprise, "ReplySandboxToken").empty());
  // Class 1 (a bundle) gets no token even there.
  auto bundle = d.request(createRequest("com.example.work", true, VSAClass::kBundleApplication));
  ASSERT_EQ(VSAReplyError(bundle), 1u);
  EXPECT_FALSE(bundle->get("ReplySandboxToken"));
  fs::remove(d.path("/run/vessad/process-personas/" + std::to_string(getpid())));
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonContainers, GroupContainersOfAnOwnerCarryTokensOnlyInEnterprisePersonas) {
  VSATestDaemon d;
  d.writePersonas("com.example.work");
  d.registerSelf("com.example.work",
                 VSAValue::Dictionary{{kAllowed, VSAValue(true)},
                                      {"com.tamsk.security.application-groups",
                                       VSAValue(VSAValue::Array{VSAValue("group.example.work")})}},
                 true);
  ASSERT_TRUE(d.start());
  VSAValue groups = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kGroupContainers)},
                                         {"Identifier", VSAValue("com.example.work")},
                                         {"ContainerClass", VSAValue(VSAClass::kAppGroup)}};
  auto dict = [](const std::optional<VSAValue>& reply, const char* key, const char* id) {
    const VSAValue* d = reply ? reply->get(key) : nullptr;
    const VSAValue* v = d ? d->get(id) : nullptr;
    return v && v->isString() ? *v->stringValue() : std::string();
  };
  auto ids =
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kGroupContainerIdentifiers)},
                                     {"Identifier", VSAValue("com.example.work")},
                                     {"ContainerClass", VSAValue(VSAClass::kAppGroup)}});
  ASSERT_EQ(VSAReplyError(ids), 1u);
  ASSERT_EQ(ids->get("ReplyGroupIdentifiersArray")->arrayValue()->size(), 1u);
  auto personal = d.request(groups);
  ASSERT_EQ(VSAReplyError(personal), 1u);
  std::string personalPath = dict(personal, "ReplyGroupContainerDict", "group.example.work");
  EXPECT_TRUE(fs::is_directory(personalPath));
  EXPECT_EQ(dict(personal, "ReplySandboxTokenDict", "group.example.work"), "");
  EXPECT_EQ(dict(personal, "ReplyPersonaUniqueStringDict", "group.example.work"), "PERSONAL-1000");
  enterPersona(d, 1001);
  auto work = d.request(groups);
  ASSERT_EQ(VSAReplyError(work), 1u);
  EXPECT_NE(dict(work, "ReplyGroupContainerDict", "group.example.work"), personalPath);
  EXPECT_FALSE(dict(work, "ReplySandboxTokenDict", "group.example.work").empty());
  EXPECT_EQ(dict(work, "ReplyPersonaUniqueStringDict", "group.example.work"), "WORK-1001");
  VSAValue paths = groups;
  paths.set("Command", VSAValue(VSACommands::kGroupContainerPaths));
  auto pathsOnly = d.request(paths);
  ASSERT_EQ(VSAReplyError(pathsOnly), 1u);
  EXPECT_EQ(dict(pathsOnly, "ReplyGroupContainerDict", "group.example.work"),
            dict(work, "ReplyGroupContainerDict", "group.example.work"));
  EXPECT_FALSE(pathsOnly->get("ReplySandboxTokenDict"));
  fs::remove(d.path("/run/vessad/process-personas/" + std::to_string(getpid())));
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonContainers, ProtectionChangeWaitsForTheUnlock) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  auto created = d.request(createRequest("com.example.app"));
  ASSERT_EQ(VSAReplyError(created), 1u);
  std::string path = VSAReplyString(created, "ReplyPath");
  std::ofstream(path + "/Library/notes") << "secret";
  VSAValue protect = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kSetDataProtection)},
                                          {"Identifier", VSAValue("com.example.app")},
                                          {"ContainerClass", VSAValue(VSAClass::kDataApplication)},
                                          {"DataProtectionClass", VSAValue(3)},
                                          {"RetryIfLocked", VSAValue(true)}};
  ASSERT_EQ(VSAReplyError(d.request(protect)), 1u);
  VSALinuxFileSystem files;
  int c = 0;
  ASSERT_EQ(files.getProtectionClass(path + "/Library/notes", &c), 0);
  EXPECT_EQ(c, 3);
  // Locked: files of class 3 cannot change, so the next change waits.
  VSALockStateService device{VSASystemRoot(d.root())};
  ASSERT_TRUE(device.setLockState(1));
  std::this_thread::sleep_for(300ms);  // let the daemon see the lock
  protect.set("DataProtectionClass", VSAValue(1));
  auto pending = std::async(std::launch::async, [&] { return d.request(protect, 20s); });
  EXPECT_EQ(pending.wait_for(1s), std::future_status::timeout);
  EXPECT_EQ(
      std::distance(
          fs::directory_iterator(d.path("/private/var/root/Library/Vessa/PendingUpdates")), {}),
      1);
  ASSERT_TRUE(device.setLockState(0));
  auto reply = pending.get();
  EXPECT_EQ(VSAReplyError(reply), 1u);
  ASSERT_EQ(files.getProtectionClass(path + "/Library/notes", &c), 0);
  EXPECT_EQ(c, 1);
  EXPECT_TRUE(fs::is_empty(d.path("/private/var/root/Library/Vessa/PendingUpdates")));
  // Class 2 is always refused.
  protect.set("DataProtectionClass", VSAValue(2));
  EXPECT_EQ(VSAReplyError(d.request(protect)), 11u);
  EXPECT_EQ(d.stop(), 0);
}

// An app nests 400 directories in its Documents (by descriptor, as an app
// can): deleting the container and emptying death row leaves nothing, on
// death row nor moved aside into the root's /tmp.
TEST(DaemonContainers, AnAppsDeepTreeGoesWholeWithItsContainer) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  auto created = d.request(createRequest("com.example.app"));
  ASSERT_EQ(VSAReplyError(created), 1u);
  std::string path = VSAReplyString(created, "ReplyPath");
  VSAUniqueFd dir(::open((path + "/Documents").c_str(), O_RDONLY | O_DIRECTORY));
  for (int i = 0; dir && i < 400; ++i) {
    ASSERT_EQ(::mkdirat(dir.get(), "nested", 0755), 0);
    dir = VSAUniqueFd(::openat(dir.get(), "nested", O_RDONLY | O_DIRECTORY));
    ASSERT_TRUE(dir);
    ASSERT_EQ(::fchown(dir.get(), 501, 501), 0);
  }
  ASSERT_TRUE(dir);
  std::ofstream(path + "/Documents/nested/nested/diary") << "private";
  VSAValue del = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kDeleteContainer)},
                                      {"Identifier", VSAValue("com.example.app")},
                                      {"ContainerClass", VSAValue(VSAClass::kDataApplication)}};
  ASSERT_EQ(VSAReplyError(d.request(del)), 1u);
  EXPECT_EQ(VSAReplyError(d.request(
                VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kDeleteDeathRow)}})),
            1u);
  std::string dead = d.path("/private/var/root/Library/Caches/com.tamsk.vessad/Dead");
  EXPECT_TRUE(!fs::exists(dead) || fs::is_empty(dead));
  EXPECT_TRUE(!fs::exists(d.path("/tmp")) || fs::is_empty(d.path("/tmp")))
      << "deleted app data was moved aside instead of removed";
  EXPECT_EQ(d.stop(), 0);
  auto verified = d.verify();
  EXPECT_EQ(verified.status, 0) << verified.output;
}

// What death row could not remove waits in the root's /tmp: the state dump
// and the root checker count it, with its size, so that it is seen.
TEST(DaemonContainers, LeftoversInTmpAreCountedByStatusAndTheRootChecker) {
  VSATestDaemon d;
  ASSERT_TRUE(d.start());
  std::string leftover = d.path("/tmp/" + VSAUUID::random().string());
  fs::create_directories(leftover + "/Documents");
  std::ofstream(leftover + "/Documents/photo") << std::string(5000, 'p');
  std::ofstream(d.path("/tmp/unrelated")) << "not death row's";
  auto status = d.vessactl("", {"status", "--json"});
  auto state = VSAJSON::parse(status.output, nullptr);
  ASSERT_TRUE(state && state->get("tmpLeftovers")) << status.output;
  const VSAValue& left = *state->get("tmpLeftovers");
  EXPECT_EQ(left.get("entries")->uint64Value().value_or(0), 1u);
  EXPECT_GE(left.get("bytes")->uint64Value().value_or(0), 5000u);
  EXPECT_EQ(d.stop(), 0);

  auto verified = d.verify(true);
  EXPECT_EQ(verified.status, 1) << verified.output;
  auto report = VSAJSON::parse(verified.output, nullptr);
  ASSERT_TRUE(report && report->get("counts")) << verified.output;
  EXPECT_EQ(report->get("counts")->get("tmpLeftovers")->uint64Value().value_or(0), 1u);
  EXPECT_GE(report->get("counts")->get("tmpLeftoverBytes")->uint64Value().value_or(0), 5000u);
  bool named = false;
  for (const VSAValue& f : *report->get("findings")->arrayValue())
    named |= *f.get("kind")->stringValue() == "deathrow-leftover" &&
             *f.get("path")->stringValue() == leftover;
  EXPECT_TRUE(named) << verified.output;
}

}  // namespace
