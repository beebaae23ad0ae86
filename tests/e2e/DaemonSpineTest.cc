// End to end: the real vessad on a temporary root, the real socket, the
// real client.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <semaphore.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "base/VSAJSON.h"
#include "base/VSAPlist.h"
#include "e2e/VSATestDaemon.h"
#include "e2e/VSATestDatabase.h"
#include "platform/VSAFrameCodec.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSALockStateService.h"
#include "platform/VSANamedSemaphore.h"

namespace {

using namespace std::chrono_literals;

const char* kAllowed = "com.tamsk.private.Vessa.allowed";

VSAValue command(VSACommandNumber n) { return VSAValue::Dictionary{{"Command", VSAValue(n)}}; }

// Starts `d` (with this process registered as a full client) and sends
// command 27 on `client`; the caller holds initialisation beforehand.
std::optional<uint64_t> sendWhileInitialisationIsHeld(VSATestDaemon& d, VSAIPCClient& client) {
  d.registerSelf("com.example.full", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  VSAErrorRef error;
  if (!d.start() || !client.connect(d.socketPath(), &error)) return std::nullopt;
  return client.send(command(VSACommands::kRetired), &error);
}

TEST(DaemonSpine, InvalidCommandsGetOnlyReplyError49) {
  VSATestDaemon d;
  d.registerSelf("com.example.full", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  // Numbers past the last command, and the retired one.
  const VSACommandNumber invalid[] = {33, 34, 1000, VSACommands::kRetired};
  for (VSACommandNumber n : invalid) {
    auto reply = d.request(command(n));
    ASSERT_TRUE(reply) << n;
    EXPECT_EQ(VSAReplyError(reply), 49u) << n;
    VSAValue keys = *reply;
    keys.remove("MessageID");
    EXPECT_EQ(keys.dictionaryValue()->size(), 1u) << reply->description();
  }
  // A request without "Command", or with one of the wrong type, is refused too.
  EXPECT_EQ(VSAReplyError(d.request(VSAValue::Dictionary{{"Identifier", VSAValue("x")}})), 49u);
  EXPECT_EQ(VSAReplyError(d.request(VSAValue::Dictionary{{"Command", VSAValue("0")}})), 49u);
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonSpine, EntitlementGatesThroughRealClients) {
  VSATestDaemon d;
  d.registerVessactl("full-client", "com.example.full",
                     VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  d.registerVessactl(
      "lookup-client", "com.example.lookup",
      VSAValue::Dictionary{{"com.tamsk.private.Vessa.lookup",
                            VSAValue::Dictionary{{"com.example.other", VSAValue(true)}}}});
  ASSERT_TRUE(d.start());
  // Command 27 is not open and does not honour the lookup dictionary: only the
  // full client reaches its handler (which always answers 49).
  auto full = d.vessactl("full-client", {"--json", "Command=27"});
  auto lookup = d.vessactl("lookup-client", {"--json", "Command=27"});
  auto unknown = d.vessactl("", {"--json", "Command=27"});
  std::string why;
  auto parse = [&](const std::string& out) { return VSAJSON::parse(out, &why); };
  EXPECT_EQ(full.status, 1);
  EXPECT_EQ(VSAReplyError(parse(full.output)), 49u) << full.output;
  EXPECT_EQ(VSAReplyError(parse(lookup.output)), 55u) << lookup.output;
  EXPECT_EQ(VSAReplyError(parse(unknown.output)), 55u) << unknown.output;
  EXPECT_EQ(unknown.status, 1);
  std::string log = d.daemonOutput();
  EXPECT_NE(log.find("(com.example.lookup) is not entitled"), std::string::npos);
  EXPECT_NE(log.find("(<unknown>) is not entitled"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonSpine, RequestSentDuringInitialisationIsAnsweredAfterIt) {
  VSATestDaemon d;
  // Initialisation is held at its first step (opening the log).
  VSAInitialisationHold hold(d.root());
  VSAIPCClient client;
  VSAErrorRef error;
  auto id = sendWhileInitialisationIsHeld(d, client);
  ASSERT_TRUE(id);
  EXPECT_FALSE(client.waitForReply(*id, 500ms, &error)) << "answered before initialisation";
  hold.release();
  auto reply = client.waitForReply(*id, 10s, &error);
  EXPECT_EQ(VSAReplyError(reply), 49u);
  std::string out = d.daemonOutput();
  EXPECT_LT(out.find("end StartingUp"), out.find("command=27, client="));
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonSpine, FirstBootWorkRunsOncePerBoot) {
  VSATestDaemon d;
  ASSERT_FALSE(VSANamedSemaphore::exists(d.firstBootSemaphore()));
  ASSERT_TRUE(d.start());
  ASSERT_TRUE(d.waitForNotifications(2));
  EXPECT_EQ(d.stop(), 0);
  EXPECT_TRUE(VSANamedSemaphore::exists(d.firstBootSemaphore()));
  // The two cleanups finish in either order.
  auto first = d.notifications();
  std::sort(first.begin(), first.end());
  EXPECT_EQ(first, (std::vector<std::string>{"com.tamsk.vessad.cleanup-complete",
                                             "com.tamsk.vessad.reboot-cleanup-complete"}));
  ASSERT_TRUE(d.start());
  ASSERT_TRUE(d.waitForNotifications(3));
  EXPECT_EQ(d.stop(), 0);
  auto second = d.notifications();
  ASSERT_EQ(second.size(), 3u);
  EXPECT_EQ(second[2], "com.tamsk.vessad.cleanup-complete");
  std::string out = d.daemonOutput();
  size_t firstBoot = out.find("vessad performing first boot initialization");
  ASSERT_NE(firstBoot, std::string::npos);
  EXPECT_EQ(out.find("vessad performing first boot initialization", firstBoot + 1),
            std::string::npos);
  // Losing the marker (a new boot) makes the next start a first boot again.
  VSANamedSemaphore::remove(d.firstBootSemaphore());
  ASSERT_TRUE(d.start());
  ASSERT_TRUE(d.waitForNotifications(5));
  EXPECT_EQ(d.stop(), 0);
  auto third = d.notifications();
  EXPECT_EQ(std::count(third.begin(), third.end(), "com.tamsk.vessad.reboot-cleanup-complete"), 2);
}

// The marker's file is in a directory every user can write. One that the
// mobile user made (as a semaphore or a plain file, with the daemon's mode or
// not) does not stand for first-boot work done: the daemon removes it, does
// the work, and makes its own.
TEST(DaemonSpine, AFirstBootMarkerMadeByTheMobileUserIsNotBelieved) {
  for (mode_t mode : {0600, 0644}) {
    VSATestDaemon d;
    std::string name = d.firstBootSemaphore();
    pid_t planter = fork();
    if (planter == 0) {
      if (setgid(501) != 0 || setuid(501) != 0) _exit(2);
      umask(0);
      sem_t* s = sem_open(("/" + name).c_str(), O_CREAT | O_EXCL, mode, 0);
      _exit(s == SEM_FAILED ? 1 : 0);
    }
    int status = -1;
    ASSERT_EQ(waitpid(planter, &status, 0), planter);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "planting as uid 501";
    struct stat st;
    ASSERT_EQ(stat(VSANamedSemaphore::backingPath(name).c_str(), &st), 0);
    ASSERT_EQ(st.st_uid, 501u);
    EXPECT_EQ(VSANamedSemaphore::stateOf(name), VSANamedSemaphore::State::Forged);

    ASSERT_TRUE(d.start());
    ASSERT_TRUE(d.waitForNotifications(2));
    EXPECT_EQ(d.stop(), 0);
    auto names = d.notifications();
    EXPECT_EQ(std::count(names.begin(), names.end(), "com.tamsk.vessad.reboot-cleanup-complete"),
              1);
    std::string out = d.daemonOutput();
    EXPECT_NE(out.find("not made by vessad"), std::string::npos);
    EXPECT_NE(out.find("vessad performing first boot initialization"), std::string::npos);
    ASSERT_EQ(stat(VSANamedSemaphore::backingPath(name).c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, 0u);
    EXPECT_EQ(st.st_mode & 07777, 0600u);
    EXPECT_TRUE(VSANamedSemaphore::exists(name));
  }
}

// A root without its mobile user is reported at once, with the command that
// provisions it, instead of being retried; that command makes it servable,
// registers vessactl as root's full client, and keeps what exists.
TEST(DaemonSpine, AnUnprovisionedRootIsReportedAndProvisionedByOneCommand) {
  VSATestDaemon d;
  std::filesystem::remove(d.path("/etc/passwd"));
  std::filesystem::remove(d.path("/etc/group"));
  ASSERT_TRUE(d.start(false));
  int status = -1;
  ASSERT_TRUE(d.waitForExit(std::chrono::seconds(10), &status)) << "it must not retry for ever";
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 78) << status;
  std::string out = d.daemonOutput();
  EXPECT_NE(out.find("no user \"mobile\""), std::string::npos) << out;
  EXPECT_NE(out.find("vessactl --root " + d.root() + " provision"), std::string::npos) << out;
  EXPECT_EQ(std::count(out.begin(), out.end(), '\n'), 1) << out;

  auto provisioned = d.vessactl("", {"provision"});
  ASSERT_EQ(provisioned.status, 0) << provisioned.output;
  struct stat st;
  ASSERT_EQ(stat(d.path("/etc/vessad/clients.d/vessactl.plist").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 022, 0u);
  ASSERT_EQ(stat(d.path("/usr/bin/vessactl").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, 0u);
  ASSERT_TRUE(d.start());
  auto made = d.vessactl("vessactl", {"create", "com.example.app"});
  EXPECT_EQ(made.status, 0) << made.output;
  EXPECT_EQ(d.vessactl("vessactl", {"lookup", "com.example.app"}).status, 0);
  EXPECT_EQ(d.stop(), 0);
  // Again, without --force: everything that exists is kept.
  std::ofstream(d.path("/etc/vessad/device.plist"), std::ios::app) << "";
  auto again = d.vessactl("", {"provision"});
  EXPECT_EQ(again.status, 0) << again.output;
  EXPECT_NE(again.output.find("kept /etc/passwd"), std::string::npos) << again.output;
  EXPECT_EQ(again.output.find("wrote"), std::string::npos) << again.output;
  EXPECT_EQ(d.vessactl("", {"provision", "--mobile-uid", "0"}).status, 2);
}

TEST(DaemonSpine, LockStateChangesReachTheRunningDaemon) {
  VSATestDaemon d;
  ASSERT_TRUE(d.start());
  VSALockStateService device{VSASystemRoot(d.root())};
  auto waitFor = [&](const std::string& text, size_t from) {
    for (int i = 0; i < 500; ++i) {
      size_t at = d.daemonOutput().find(text, from);
      if (at != std::string::npos) return at;
      std::this_thread::sleep_for(10ms);
    }
    return std::string::npos;
  };
  size_t start = waitFor("LockState=0", 0);
  ASSERT_NE(start, std::string::npos);
  ASSERT_TRUE(device.setLockState(1));
  size_t locked = waitFor("LockState=1", start);
  EXPECT_NE(locked, std::string::npos);
  ASSERT_TRUE(device.setLockState(0));
  EXPECT_NE(waitFor("LockState=0", locked), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonSpine, GarbageFramesLeaveTheDaemonServingOthers) {
  VSATestDaemon d;
  d.registerSelf("com.example.full", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  VSAErrorRef error;
  VSAIPCClient good, garbage, oversized, array, truncated;
  for (VSAIPCClient* c : {&good, &garbage, &oversized, &array, &truncated})
    ASSERT_TRUE(c->connect(d.socketPath(), &error));
  uint8_t junk[] = {0, 0, 0, 6, 'b', 'p', 'l', 'i', 's', 't'};
  ASSERT_TRUE(garbage.sendRaw(junk, sizeof junk, &error));
  uint8_t huge[] = {0x10, 0, 0, 0};
  ASSERT_TRUE(oversized.sendRaw(huge, sizeof huge, &error));
  auto arr = *VSAFrameCodec::encode(VSAValue(VSAValue::Array{VSAValue(1)}), &error);
  ASSERT_TRUE(array.sendRaw(arr.data(), arr.size(), &error));
  auto frame = *VSAFrameCodec::encode(command(VSACommands::kRetired), &error);
  ASSERT_TRUE(truncated.sendRaw(frame.data(), frame.size() - 3, &error));
  truncated.close();
  EXPECT_TRUE(garbage.waitForClose(5s));
  EXPECT_TRUE(oversized.waitForClose(5s));
  EXPECT_TRUE(array.waitForClose(5s));
  EXPECT_EQ(VSAReplyError(good.sendRequest(command(VSACommands::kRetired), 5s, &error)), 49u);
  std::string out = d.daemonOutput();
  EXPECT_NE(out.find("Dictionary does not have reply context"), std::string::npos);
  EXPECT_NE(out.find("exceeds the limit"), std::string::npos);
  EXPECT_NE(out.find("stream ended inside a frame"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonSpine, StopsCleanlyAndRemovesItsSocket) {
  VSATestDaemon d;
  ASSERT_TRUE(d.start());
  EXPECT_TRUE(std::filesystem::exists(d.socketPath()));
  EXPECT_EQ(d.stop(), 0);
  EXPECT_FALSE(std::filesystem::exists(d.socketPath()));
  std::ifstream log(d.path("/private/var/root/Library/Logs/Vessa/vessad.log"));
  std::string text((std::istreambuf_iterator<char>(log)), std::istreambuf_iterator<char>());
  EXPECT_NE(text.find("vessad stopped"), std::string::npos);
  EXPECT_NE(text.find("vessad performing first boot initialization"), std::string::npos);
  // The subsystems are built after the log is open: their start-up lines are in it.
  EXPECT_NE(text.find("Current mobile user ID is"), std::string::npos);
}

}  // namespace

namespace {

std::vector<std::string> personaStrings(const VSATestDaemon::Run& run) {
  std::string why;
  auto reply = VSAJSON::parse(run.output, &why);
  std::vector<std::string> out;
  if (!reply || !reply->get("ReplyPersonaUniqueStringsArray")) return out;
  for (const VSAValue& v : *reply->get("ReplyPersonaUniqueStringsArray")->arrayValue())
    out.push_back(*v.stringValue());
  return out;
}

void writePersonas(VSATestDaemon& d, bool workAppInEnterprise) {
  VSAValue enterprise = VSAValue::Dictionary{{"PersonaID", VSAValue(1001)},
                                             {"Kind", VSAValue("enterprise")},
                                             {"UniqueString", VSAValue("E-1001")},
                                             {"LayoutPath", VSAValue("/private/var/enterprise")}};
  if (workAppInEnterprise)
    enterprise.set("BundleIdentifiers", VSAValue(VSAValue::Array{VSAValue("com.app.work")}));
  VSAValue list =
      VSAValue::Array{VSAValue(VSAValue::Dictionary{{"PersonaID", VSAValue(1000)},
                                                    {"Kind", VSAValue("personal")},
                                                    {"UniqueString", VSAValue("P-1000")}}),
                      enterprise};
  VSAErrorRef error;
  auto bytes = VSAPlist::serialize(list, VSAPlist::Format::XML, &error);
  VSAWriteFileAtomically(d.path("/etc/vessad/personas.plist"), *bytes, 0644, &error);
}

TEST(DaemonPersonas, EditingThePersonaFileChangesARunningDaemonsAnswers) {
  VSATestDaemon d;
  d.registerVessactl("work-client", "com.app.work", VSAValue::dictionary());
  writePersonas(d, true);
  ASSERT_TRUE(d.start());
  EXPECT_EQ(personaStrings(d.vessactl("work-client", {"--json", "Command=32"})),
            std::vector<std::string>{"E-1001"});
  // The enterprise persona stops listing the app: it now runs only in the
  // personal persona. The daemon notices the file change by itself.
  writePersonas(d, false);
  std::vector<std::string> now;
  for (int i = 0; i < 200; ++i) {
    now = personaStrings(d.vessactl("work-client", {"--json", "Command=32"}));
    if (now == std::vector<std::string>{"P-1000"}) break;
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_EQ(now, std::vector<std::string>{"P-1000"});
  EXPECT_NE(d.daemonOutput().find("Persona list update received"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace

namespace {

// SIGTERM while a request is still waiting to be served: the daemon stops
// accepting, answers what it already received, and only then exits.
TEST(DaemonShutdown, WaitsForOpenTransactionsBeforeExiting) {
  VSATestDaemon d;
  VSAInitialisationHold hold(d.root());
  VSAIPCClient client;
  VSAErrorRef error;
  auto id = sendWhileInitialisationIsHeld(d, client);
  ASSERT_TRUE(id);
  std::this_thread::sleep_for(200ms);
  std::thread stopper([&] { EXPECT_EQ(d.stop(), 0); });
  std::this_thread::sleep_for(300ms);
  // The stop is waiting on the request's transaction; release initialisation.
  hold.release();
  EXPECT_EQ(VSAReplyError(client.waitForReply(*id, 10s, &error)), 49u)
      << "the request received before SIGTERM is still answered";
  stopper.join();
  EXPECT_FALSE(std::filesystem::exists(d.socketPath()));
  VSAIPCClient late;
  EXPECT_FALSE(late.connect(d.socketPath(), &error)) << "nothing listens after the stop";
}

}  // namespace

namespace {

TEST(DaemonCodeSigning, RecordThenReadThroughTheRealDaemon) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  ASSERT_TRUE(d.start());
  VSAValue info = VSAValue::Dictionary{
      {"com.tamsk.Vessa.Entitlements",
       VSAValue::Dictionary{{"com.tamsk.security.application-groups", VSAValue("group.demo")}}},
      {"TeamIdentifier", VSAValue("TEAM")}};
  auto record = [&](const char* id, VSAValue options) {
    return d.request(
        VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kRecordCodeSigningInfo)},
                             {"Identifier", VSAValue(id)},
                             {"CodeSigningInfo", info},
                             {"OptionsDictionary", options}});
  };
  EXPECT_EQ(VSAReplyError(record("com.example.app", VSAValue::dictionary())), 1u);
  auto read =
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)},
                                     {"Identifier", VSAValue("com.example.app")}});
  ASSERT_TRUE(read && read->get("ReplyInfoDictionary"));
  EXPECT_EQ(*read->get("ReplyInfoDictionary"), info);
  // A placeholder is recorded but not shown to clients.
  EXPECT_EQ(VSAReplyError(record(
                "com.example.placeholder",
                VSAValue::Dictionary{{"com.tamsk.Vessa.PlaceholderEntitlements", VSAValue(true)}})),
            1u);
  auto hidden =
      d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)},
                                     {"Identifier", VSAValue("com.example.placeholder")}});
  EXPECT_EQ(VSAReplyError(hidden), 1u);
  EXPECT_FALSE(hidden->get("ReplyInfoDictionary"));
  EXPECT_EQ(VSAReplyError(d.request(
                VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)}})),
            18u);
  EXPECT_TRUE(
      std::filesystem::exists(d.path("/private/var/root/Library/Vessa/containers.sqlite3")));
  EXPECT_EQ(d.stop(), 0);
}

// A registration that drops an identifier's last group deletes the group's
// container only once the new entry is written: while the database refuses
// the write, the stored entry still names the group and its container stays.
TEST(DaemonCodeSigning, AGroupStaysWhileTheRegistrationThatDropsItIsNotWritten) {
  VSATestDaemon d;
  d.registerSelf("com.example.installer", VSAValue::Dictionary{{kAllowed, VSAValue(true)}});
  auto record = [&](VSAValue entitlements) {
    return VSAReplyError(d.request(VSAValue::Dictionary{
        {"Command", VSAValue(VSACommands::kRecordCodeSigningInfo)},
        {"Identifier", VSAValue("com.example.app")},
        {"CodeSigningInfo",
         VSAValue::Dictionary{{"com.tamsk.Vessa.Entitlements", std::move(entitlements)}}}}));
  };
  auto group = [&] {
    return VSAReplyString(
        d.request(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kCreateOrLookup)},
                                       {"Identifier", VSAValue("group.example.only")},
                                       {"ContainerClass", VSAValue(VSAClass::kAppGroup)},
                                       {"CreateIfNecessary", VSAValue(true)}}),
        "ReplyPath");
  };
  ASSERT_TRUE(d.start());
  ASSERT_EQ(record(VSAValue::Dictionary{
                {"com.tamsk.security.application-groups", VSAValue("group.example.only")}}),
            1u);
  std::string path = group();
  ASSERT_FALSE(path.empty());
  EXPECT_EQ(d.stop(), 0);
  ASSERT_EQ(VSARefuseEntryWrites(d, "com.example.app", true), "");
  ASSERT_TRUE(d.start());
  EXPECT_NE(record(VSAValue::dictionary()), 1u);
  EXPECT_TRUE(std::filesystem::exists(path + "/.com.tamsk.vessa_keeper.metadata.plist"));
  EXPECT_EQ(d.stop(), 0);
  ASSERT_EQ(VSARefuseEntryWrites(d, "com.example.app", false), "");
  ASSERT_TRUE(d.start());
  EXPECT_EQ(record(VSAValue::dictionary()), 1u);
  EXPECT_FALSE(std::filesystem::exists(path)) << "written: the group goes";
  EXPECT_EQ(d.stop(), 0);
}

TEST(DaemonCodeSigning, ASecondDaemonOnTheSameRootStopsAtStartUp) {
  VSATestDaemon first;
  ASSERT_TRUE(first.start());
  // A second vessad on the same root must refuse to share the database.
  pid_t pid = fork();
  if (pid == 0) {
    int devnull = open("/dev/null", O_WRONLY);
    dup2(devnull, 2);
    execl(VESSAD_PATH, "vessad", "--root", first.root().c_str(), nullptr);
    _exit(127);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFSIGNALED(status) || (WIFEXITED(status) && WEXITSTATUS(status) != 0));
  EXPECT_EQ(VSAReplyError(first.request(command(VSACommands::kRetired))), 55u)
      << "the first daemon still serves";
  EXPECT_EQ(first.stop(), 0);
}

}  // namespace
