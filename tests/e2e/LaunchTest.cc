// End to end: apps started by vessa-launch against the real daemon, each
// confined by Landlock to its own containers, and served as itself.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <thread>

#include "VSALaunchOptions.h"
#include "VSALauncher.h"
#include "base/VSAJSON.h"
#include "e2e/VSATestDaemon.h"
#include "platform/VSALandlock.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

namespace {

// Prints "ALLOWED label" or "DENIED label" for each attempt an app makes.
const char* kAttempt =
    "t() { label=$1; shift; if \"$@\" >/dev/null 2>&1; then echo \"ALLOWED $label\"; "
    "else echo \"DENIED $label\"; fi; }\n";

bool landlockAvailable() { return VSALinuxLandlock().abiVersion() >= 1; }

class LaunchedApps : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!landlockAvailable()) GTEST_SKIP() << "the kernel offers no Landlock";
    ::chmod(d.root().c_str(), 0755);  // apps of uid 501 reach the daemon through the root
    d.registerLaunchTool();
    d.registerVessactl("admin", "com.example.admin",
                       VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
    ASSERT_TRUE(d.start());
  }

  VSATestDaemon::Run launch(const std::string& id, std::vector<std::string> options,
                            const std::string& script, std::vector<std::string> args = {}) {
    std::vector<std::string> argv = {"--signing-id", id};
    argv.insert(argv.end(), options.begin(), options.end());
    for (const char* a : {"--", "/bin/sh", "-c"}) argv.push_back(a);
    argv.push_back(std::string(kAttempt) + script);
    argv.push_back("app");
    argv.insert(argv.end(), args.begin(), args.end());
    return d.vessactl("vessa-launch", argv);
  }

  VSAValue rules(const std::string& id, std::vector<std::string> options = {}) {
    std::vector<std::string> argv = {"--signing-id", id, "--print-rules"};
    argv.insert(argv.end(), options.begin(), options.end());
    auto run = d.vessactl("vessa-launch", argv);
    EXPECT_EQ(run.status, 0) << run.output;
    std::string why;
    auto parsed = VSAJSON::parse(run.output, &why);
    EXPECT_TRUE(parsed && parsed->isDictionary()) << run.output;
    return parsed ? *parsed : VSAValue::dictionary();
  }

  static std::string text(const VSAValue& v, const char* key) {
    const VSAValue* s = v.get(key);
    return s && s->isString() ? *s->stringValue() : "";
  }

  std::string adminPath(const std::vector<std::string>& args) {
    auto run = d.vessactl("admin", args);
    auto at = run.output.find("Path:");
    if (at == std::string::npos) return "";
    auto start = run.output.find('/', at);
    return run.output.substr(start, run.output.find('\n', start) - start);
  }

  // Installs vessactl in `id`'s bundle container, where an app's program lives.
  std::string installInBundle(const std::string& id) {
    std::string bundle = adminPath({"create", id, "--class", "bundle"});
    EXPECT_FALSE(bundle.empty());
    fs::copy_file(VESSACTL_PATH, bundle + "/app-client", fs::copy_options::overwrite_existing);
    ::chmod((bundle + "/app-client").c_str(), 0755);
    return bundle + "/app-client";
  }

  VSATestDaemon d;
};

void expectLines(const std::string& output, const std::vector<std::string>& lines) {
  for (const auto& line : lines)
    EXPECT_NE(output.find(line + "\n"), std::string::npos) << line << " in:\n" << output;
}

TEST_F(LaunchedApps, EachAppReachesOnlyItsOwnContainersAndTheGroupTheyShare) {
  fs::remove("/tmp/vessa-launch-escape");
  VSAValue a = rules("com.example.a", {"--group", "group.example.shared"});
  VSAValue b = rules("com.example.b", {"--group", "group.example.shared"});
  std::string aHome = text(a, "Home"), bHome = text(b, "Home");
  std::string group = text(*a.get("GroupContainers"), "group.example.shared");
  ASSERT_FALSE(aHome.empty());
  ASSERT_NE(aHome, bHome);
  ASSERT_EQ(group, text(*b.get("GroupContainers"), "group.example.shared"));

  auto first = launch("com.example.a", {"--group", "group.example.shared"},
                      "id -u; echo \"home=$HOME\"; echo \"pwd=$(pwd)\"\n"
                      "t own-write sh -c 'echo secret > Documents/a.txt'\n"
                      "t group-write sh -c 'echo from-a > \"$1/from-a\"' _ \"$1\"\n",
                      {group});
  EXPECT_EQ(first.status, 0) << first.output;
  expectLines(first.output,
              {"501", "home=" + aHome, "pwd=" + aHome, "ALLOWED own-write", "ALLOWED group-write"});

  auto second = launch("com.example.b", {"--group", "group.example.shared"},
                       "echo mine > \"$HOME/Documents/b.txt\"\n"
                       "t read cat \"$1/Documents/a.txt\"\n"
                       "t list ls \"$1\"\n"
                       "t list-class ls \"$(dirname \"$HOME\")\"\n"
                       "t write sh -c 'echo x >> \"$1/Documents/a.txt\"' _ \"$1\"\n"
                       "t truncate truncate -s 0 \"$1/Documents/a.txt\"\n"
                       "t create sh -c 'echo x > \"$1/Documents/new.txt\"' _ \"$1\"\n"
                       "t rename-into mv \"$HOME/Documents/b.txt\" \"$1/Documents/b.txt\"\n"
                       "t rename-from mv \"$1/Documents/a.txt\" \"$HOME/Documents/stolen\"\n"
                       "t link-from ln \"$1/Documents/a.txt\" \"$HOME/Documents/linked\"\n"
                       "t child-read sh -c 'cat \"$1/Documents/a.txt\"' _ \"$1\"\n"
                       "t exec-read env cat \"$1/Documents/a.txt\"\n"
                       "t tmp-write sh -c 'echo x > /tmp/vessa-launch-escape'\n"
                       "t own-read cat \"$HOME/Documents/b.txt\"\n"
                       "t group-read cat \"$2/from-a\"\n"
                       "t group-write sh -c 'echo from-b > \"$1/from-b\"' _ \"$2\"\n",
                       {aHome, group});
  EXPECT_EQ(second.status, 0) << second.output;
  expectLines(second.output,
              {"DENIED read", "DENIED list", "DENIED list-class", "DENIED write", "DENIED truncate",
               "DENIED create", "DENIED rename-into", "DENIED rename-from", "DENIED link-from",
               "DENIED child-read", "DENIED exec-read", "DENIED tmp-write", "ALLOWED own-read",
               "ALLOWED group-read", "ALLOWED group-write"});
  std::ifstream kept(aHome + "/Documents/a.txt");
  std::string content;
  std::getline(kept, content);
  EXPECT_EQ(content, "secret") << "the first app's file is unchanged";
  EXPECT_FALSE(fs::exists(aHome + "/Documents/new.txt"));
  EXPECT_FALSE(fs::exists("/tmp/vessa-launch-escape"));

  auto back = launch("com.example.a", {"--group", "group.example.shared"},
                     "t group-read-back cat \"$1/from-b\"\n", {group});
  expectLines(back.output, {"ALLOWED group-read-back"});
  EXPECT_TRUE(fs::is_empty(d.path("/run/vessad/process-signing-identifiers")))
      << "records go when the app ends";
}

TEST_F(LaunchedApps, AConfinedAppIsServedAsItselfAndReachesNoDaemonState) {
  ASSERT_EQ(d.vessactl("admin", {"cs", "set", "com.example.a",
                                 "{\"com.tamsk.Vessa.Entitlements\": "
                                 "{\"com.tamsk.security.application-groups\": "
                                 "[\"group.example.granted\"]}}"})
                .status,
            0);
  std::string client = installInBundle("com.example.a");
  std::string home = text(rules("com.example.a"), "Home");
  std::string state;
  for (const auto& e : fs::recursive_directory_iterator(d.path("/private/var/root")))
    if (e.is_regular_file()) state = e.path().string();
  ASSERT_FALSE(state.empty()) << "the daemon keeps state below its home";
  const std::string& r = d.root();
  auto run = launch("com.example.a", {},
                    "\"$1\" --root \"$2\" --json lookup com.example.a\n"
                    "\"$1\" --root \"$2\" lookup com.example.other >/dev/null 2>&1; "
                    "echo \"other=$?\"\n"
                    "for c in 13 16; do echo \"command $c: $(\"$1\" --root \"$2\" --json "
                    "Command=$c Identifier=com.example.a ContainerClass=7 | "
                    "grep -q group.example.granted && echo granted)\"; done\n"
                    "t state-read cat \"$3\"\n"
                    "t state-list ls \"$2/private/var/root\"\n"
                    "t device-config cat \"$2/etc/passwd\"\n"
                    "t root-home ls /root\n",
                    {client, r, state});
  EXPECT_EQ(run.status, 0) << run.output;
  EXPECT_NE(run.output.find("\"ReplyPath\": \"" + home + "\""), std::string::npos) << run.output;
  EXPECT_NE(run.output.find("other=1"), std::string::npos) << "another app's container: refused\n"
                                                           << run.output;
  expectLines(run.output, {"command 13: granted", "command 16: granted"});  // groups from its entry
  expectLines(run.output, {"DENIED state-read", "DENIED state-list", "DENIED device-config",
                           "DENIED root-home"});
  EXPECT_NE(d.daemonOutput().find("sandboxed = 1, bundleIdentifier = com.example.a>"),
            std::string::npos);
}

TEST_F(LaunchedApps, APlugInGetsItsPlugInDataContainerByFlagOrByRegistration) {
  std::string home = text(rules("com.example.widget", {"--plugin"}), "Home");
  EXPECT_EQ(home, adminPath({"lookup", "com.example.widget", "--class", "plugin-data"}));
  auto run = launch("com.example.widget", {"--plugin"}, "echo \"home=$HOME\"\n");
  expectLines(run.output, {"home=" + home});

  // Registered as a plug-in by its installer (vessactl cs set's options), it
  // gets the same container without the flag.
  ASSERT_EQ(d.vessactl("admin", {"cs", "set", "com.example.gadget", "{}",
                                 "{\"com.tamsk.Vessa.DataContainerClass\": 4}"})
                .status,
            0);
  std::string gadgetHome = text(rules("com.example.gadget"), "Home");
  EXPECT_EQ(gadgetHome, adminPath({"lookup", "com.example.gadget", "--class", "plugin-data"}));
  EXPECT_NE(d.vessactl("admin", {"cs", "set", "com.example.gadget", "{}", "[4]"}).status, 0)
      << "options that are not an object are refused";
}

TEST_F(LaunchedApps, AnEnterpriseAppIsConfinedToItsPersonasContainers) {
  d.writePersonas("com.work");
  ::chown(d.path("/private/var/enterprise/1001").c_str(), 501, 501);
  std::string client = installInBundle("com.work");
  std::string work = text(rules("com.work", {"--persona", "1001"}), "Home");
  std::string personal = text(rules("com.work"), "Home");
  ASSERT_EQ(work.rfind(d.path("/private/var/enterprise/1001/"), 0), 0u) << work;
  ASSERT_NE(work, personal);
  auto run = launch("com.work", {"--persona", "1001"},
                    "echo \"home=$HOME\"\n"
                    "t own-write sh -c 'echo work > \"$HOME/Documents/w.txt\"'\n"
                    "t personal-read ls \"$1\"\n"
                    "\"$2\" --root \"$3\" --json lookup com.work\n",
                    {personal, client, d.root()});
  expectLines(run.output, {"home=" + work, "ALLOWED own-write", "DENIED personal-read"});
  EXPECT_NE(run.output.find("\"ReplyPath\": \"" + work + "\""), std::string::npos)
      << "asked from inside, its own container is the persona's\n"
      << run.output;
  auto other = launch("com.work", {}, "t work-read cat \"$1/Documents/w.txt\"\n", {work});
  expectLines(other.output, {"DENIED work-read"});
}

TEST_F(LaunchedApps, ExitStatusesNameTheFailureAndSignalsArePassedOn) {
  EXPECT_EQ(
      d.vessactl("vessa-launch", {"--signing-id", "com.example.a", "--", "/nonexistent/x"}).status,
      127);
  EXPECT_EQ(
      d.vessactl("vessa-launch", {"--signing-id", "com.example.a", "--", "/etc/passwd"}).status,
      126);
  EXPECT_EQ(launch("com.example.a", {}, "exit 7").status, 7);
  auto usage = d.vessactl("vessa-launch", {"--", "/bin/true"});
  EXPECT_EQ(usage.status, 125);
  EXPECT_NE(usage.output.find("--signing-id is required"), std::string::npos);

  fs::copy_file(VESSA_LAUNCH_PATH, d.path("/usr/bin/not-the-bridge"));
  auto refused = d.vessactl("not-the-bridge", {"--signing-id", "com.example.a", "--", "/bin/true"});
  EXPECT_EQ(refused.status, 125);
  EXPECT_NE(refused.output.find("com.example.a: upcall: return code 5"), std::string::npos)
      << refused.output;

  std::string launcher = d.path("/usr/bin/vessa-launch");
  pid_t pid = fork();
  if (pid == 0) {
    int null = ::open("/dev/null", O_WRONLY);
    dup2(null, 1);
    dup2(null, 2);
    execl(launcher.c_str(), launcher.c_str(), "--root", d.root().c_str(), "--signing-id",
          "com.example.a", "--", "/bin/sleep", "30", nullptr);
    _exit(99);
  }
  // Once the app runs, its record is there.
  for (int i = 0; i < 100 && fs::is_empty(d.path("/run/vessad/process-signing-identifiers")); ++i)
    std::this_thread::sleep_for(50ms);
  std::this_thread::sleep_for(100ms);
  kill(pid, SIGTERM);
  int status = 0;
  waitpid(pid, &status, 0);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 128 + SIGTERM)
      << "the app got SIGTERM and its status is passed on";
  EXPECT_TRUE(fs::is_empty(d.path("/run/vessad/process-signing-identifiers")));
}

// A kernel without Landlock, or one that refuses the ruleset.
class VSAMissingLandlock : public VSALandlock {
 public:
  explicit VSAMissingLandlock(int restrictError) : restrictError_(restrictError) {}
  int abiVersion() override { return restrictError_ ? real_.abiVersion() : -ENOSYS; }
  int createRuleset(uint64_t handled, int abi) override {
    return real_.createRuleset(handled, abi);
  }
  int allowBeneath(int ruleset, int fd, uint64_t access) override {
    return real_.allowBeneath(ruleset, fd, access);
  }
  int restrictSelf(int) override { return -restrictError_; }

 private:
  int restrictError_;
  VSALinuxLandlock real_;
};

TEST(LaunchWithoutLandlock, TheAppStartsOnlyWhenUnconfinedIsAskedFor) {
  VSATestDaemon d;
  ::chmod(d.root().c_str(), 0755);
  d.registerSelfAsKernelBridge();
  ASSERT_TRUE(d.start());
  auto attempt = [&](VSALandlock& landlock, bool unconfined) {
    VSALaunchOptions o;
    o.root = d.root();
    o.signingIdentifier = "com.example.a";
    o.unconfined = unconfined;
    o.program = {"/bin/sh", "-c", "touch \"$HOME/started\""};
    int status = VSALauncher(o, landlock).run();
    for (int s : {SIGINT, SIGTERM, SIGHUP}) ::signal(s, SIG_DFL);
    return status;
  };
  auto started = [&] {
    for (const auto& e :
         fs::directory_iterator(d.path("/private/var/mobile/Containers/Data/Application")))
      if (fs::exists(e.path() / "started")) return fs::remove(e.path() / "started");
    return false;
  };
  VSAMissingLandlock missing(0);
  EXPECT_EQ(attempt(missing, false), 125);
  EXPECT_FALSE(started()) << "without Landlock the app does not start";
  EXPECT_EQ(attempt(missing, true), 0);
  EXPECT_TRUE(started()) << "--unconfined starts it anyway";
  if (!landlockAvailable()) return;
  VSAMissingLandlock refusing(EPERM);
  EXPECT_EQ(attempt(refusing, false), 125);
  EXPECT_FALSE(started()) << "a refused ruleset stops the app before it runs";
}

}  // namespace
