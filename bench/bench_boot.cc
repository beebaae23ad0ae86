// Boot of a device with many containers and orphans: the real vessad,
// started as the first daemon after a boot on a copy of the device, timed
// from its start to the first served request and to the notification that
// the first-boot cleanup is complete; the baseline is a raw walk over an
// identical copy that stats every class directory entry and its metadata
// file and renames the same orphans into one directory.
//
//   build/bench/bench_boot [CONTAINERS [ORPHANS]]   (defaults 10000 and 1000)
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "VSABenchTable.h"
#include "base/VSACommands.h"
#include "base/VSALog.h"
#include "base/VSAPlist.h"
#include "base/VSAUUID.h"
#include "daemon/VSAClientConnection.h"
#include "migration/VSAMigrationStatus.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSANotificationCenter.h"

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

namespace {

double seconds(Clock::time_point from) {
  return std::chrono::duration<double>(Clock::now() - from).count();
}

// Two personas: the personal one and an enterprise one with its own layout,
// in which one app of five keeps its per-user containers.
void writePersonas(const std::string& root) {
  VSAValue personas = VSAValue::Array{
      VSAValue::Dictionary{{"PersonaID", VSAValue(1000u)},
                           {"Kind", VSAValue("personal")},
                           {"UniqueString", VSAValue("PERSONAL-1000")}},
      VSAValue::Dictionary{{"PersonaID", VSAValue(1001u)},
                           {"Kind", VSAValue("enterprise")},
                           {"UniqueString", VSAValue("WORK-1001")},
                           {"LayoutPath", VSAValue("/private/var/enterprise/1001")}}};
  fs::create_directories(root + "/private/var/enterprise/1001");
  VSA_writeToURL(personas, root + "/etc/vessad/personas.plist", 0, nullptr);
}

// Containers of ten classes' mix, a fifth of the per-user ones in the
// enterprise persona, made through the daemon's own creation path.
std::vector<std::string> populate(const std::string& root, int containers, int orphans) {
  fs::create_directories(root + "/etc");
  fs::create_directories(root + "/private/var/mobile");
  std::ofstream(root + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
  std::ofstream(root + "/etc/group") << "mobile:x:501:\n";
  // A device booting the build it last ran: a plain boot, not an upgrade.
  fs::create_directories(root + "/etc/vessad");
  VSA_writeToURL(
      VSAValue::Dictionary{{"BuildVersion", VSAValue("BENCH1")}, {"ReleaseType", VSAValue("User")}},
      root + "/etc/vessad/system-version.plist", 0, nullptr);
  writePersonas(root);
  VSADaemonContext context{VSASystemRoot(root)};
  VSAMigrationStatus::initForSystemMigration(*context.globalConfiguration,
                                             root + "/etc/vessad/system-version.plist")
      ->writeCurrentBuildInfoToDisk();
  auto connection = VSAClientConnection::sharedClientConnection(context);
  auto user = context.userIdentityCache->defaultUserIdentity();
  auto work = context.userIdentityCache->userIdentityForPersonaUniqueString(
      std::string("WORK-1001"), 501, 501);
  if (!work) {
    std::fprintf(stderr, "bench_boot: no enterprise persona\n");
    std::exit(1);
  }
  using namespace VSAClass;
  const VSAContainerClass classes[] = {kDataApplication,   kDataApplication,   kDataApplication,
                                       kDataPlugin,        kDataPlugin,        kAppGroup,
                                       kBundleApplication, kBundleApplication, kDataVPNPlugin,
                                       kDataInternalDaemon};
  std::vector<std::string> classDirectories;
  for (int i = 0; i < containers; ++i) {
    VSAContainerClass c = classes[i % 10];
    bool enterprise = VSAContainerClassIsPerUser(c) && (i / 10) % 5 == 4;
    auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(
        enterprise ? work : user, "com.bench.app" + std::to_string(i), c, nullptr);
    VSAResultCode code = VSAResult::kSuccess;
    if (!connection->createOrLookupContainerWithContainerIdentity(
            identity, {.createIfNecessary = true}, &code)) {
      std::fprintf(stderr, "creation failed: %llu\n", static_cast<unsigned long long>(code));
      std::exit(1);
    }
  }
  for (VSAContainerClass c : {kBundleApplication, kDataApplication, kDataPlugin, kDataVPNPlugin,
                              kAppGroup, kDataInternalDaemon}) {
    classDirectories.push_back(
        *context.globalConfiguration->containerDirectoryURLForUserIdentity(user, c, false));
    if (VSAContainerClassIsPerUser(c))
      classDirectories.push_back(
          *context.globalConfiguration->containerDirectoryURLForUserIdentity(work, c, false));
  }
  for (int i = 0; i < orphans; ++i) {
    std::string dir = classDirectories[i % classDirectories.size()] + "/" +
                      (i % 4 ? VSAUUID::random().string() : "stray-" + std::to_string(i));
    fs::create_directories(dir + "/Documents");
    std::ofstream(dir + "/Documents/left") << "x";
  }
  return classDirectories;
}

// The same examination and the same renames, without the daemon.
double rawBoot(const std::string& root, const std::vector<std::string>& classDirectories) {
  std::string graveyard = root + "/graveyard";
  fs::create_directories(graveyard);
  auto start = Clock::now();
  int renamed = 0;
  for (const auto& dir : classDirectories) {
    DIR* d = opendir(dir.c_str());
    if (!d) continue;
    std::vector<std::string> names;
    while (dirent* e = readdir(d))
      if (e->d_name[0] != '.') names.push_back(e->d_name);
    closedir(d);
    for (const auto& name : names) {
      std::string path = dir + "/" + name;
      struct stat st;
      if (lstat(path.c_str(), &st) != 0) continue;
      bool valid = VSAUUID::parse(name).has_value();
      if (valid && lstat((path + "/.com.tamsk.vessa_keeper.metadata.plist").c_str(), &st) == 0)
        continue;
      if (rename(path.c_str(), (graveyard + "/" + std::to_string(renamed++)).c_str()) != 0)
        std::perror("rename");
    }
  }
  return seconds(start);
}

struct DaemonBoot {
  double firstReply = 0, cleanupComplete = 0;
};

DaemonBoot daemonBoot(const std::string& vessad, const std::string& root) {
  VSANotificationCenter notifications{VSASystemRoot(root)};
  auto start = Clock::now();
  pid_t pid = fork();
  if (pid == 0) {
    int devnull = ::open("/dev/null", O_WRONLY);
    dup2(devnull, 1);
    dup2(devnull, 2);
    execl(vessad.c_str(), vessad.c_str(), "--root", root.c_str(), "--after-boot", nullptr);
    _exit(127);
  }
  DaemonBoot boot;
  std::string socket = VSASystemRoot(root).socketPath();
  while (boot.cleanupComplete == 0 && seconds(start) < 600) {
    if (boot.firstReply == 0) {
      VSAIPCClient client;
      if (client.connect(socket, nullptr) &&
          client.sendRequest(
              VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kPersonaUniqueStrings)}},
              std::chrono::seconds(60), nullptr))
        boot.firstReply = seconds(start);
    }
    for (const auto& name : notifications.postedNames())
      if (name == CONTAINER_NOTIFY_REBOOT_CLEANUP_COMPLETE) boot.cleanupComplete = seconds(start);
    std::this_thread::sleep_for(std::chrono::milliseconds(1));  // leave the cores to the daemon
  }
  kill(pid, SIGTERM);
  waitpid(pid, nullptr, 0);
  return boot;
}

}  // namespace

int main(int argc, char** argv) {
  int containers = argc > 1 ? std::atoi(argv[1]) : 10000;
  int orphans = argc > 2 ? std::atoi(argv[2]) : 1000;
  VSALogger::shared().setLevel(2);
  std::string vessad = (fs::canonical("/proc/self/exe").parent_path().parent_path() / "vessad");
  char templ[] = "/tmp/vessa-bench-boot-XXXXXX";
  std::string base = mkdtemp(templ);
  std::string device = base + "/device", raw = base + "/raw";
  auto made = Clock::now();
  auto classDirectories = populate(device, containers, orphans);
  std::printf("made %d containers and %d orphans in %.1f s\n", containers, orphans, seconds(made));
  fs::copy(device, raw, fs::copy_options::recursive);
  for (auto& dir : classDirectories) dir.replace(0, device.size(), raw);
  sync();
  double baseline = rawBoot(raw, classDirectories);
  sync();  // the daemon's first fsync must not flush the baseline's renames
  DaemonBoot boot = daemonBoot(vessad, device);
  std::printf("\n%-52s %10s\n", "measure", "seconds");
  std::printf("%-52s %10.3f\n", "raw walk: stat entries + metadata, rename orphans", baseline);
  std::printf("%-52s %10.3f\n", "vessad start -> first served request", boot.firstReply);
  std::printf("%-52s %10.3f\n", "vessad start -> first-boot cleanup complete",
              boot.cleanupComplete);
  double ratio = boot.cleanupComplete > 0 ? baseline / boot.cleanupComplete : 0;
  std::printf("\nboot to cleanup-complete vs raw walk: ratio %.2fx (target 0.50x) %s\n", ratio,
              ratio >= 0.5 ? "ok" : "BELOW TARGET");
  VSABenchRecord("boot to cleanup-complete", "raw stat walk", ratio, 0);
  if (boot.firstReply > 0)
    VSABenchRecord("boot to serving", "raw stat walk", baseline / boot.firstReply, 0);
  std::printf("first request served %s the cleanup completed\n",
              boot.firstReply <= boot.cleanupComplete ? "before (or as)" : "after");
  if (std::getenv("BENCH_KEEP")) {
    std::printf("kept %s (device: the daemon's copy after its boot; raw: the baseline's)\n",
                base.c_str());
    return 0;
  }
  fs::remove_all(base);
  return 0;
}
