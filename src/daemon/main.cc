// vessad: the container-keeping daemon.
//
//   vessad [--root DIR] [--log-level N] [--stderr] [--after-boot] [--idle-exit SECONDS]
//   vessad --verify [--root DIR] [--json]     check a root offline (exit 0/1/2)
//
// SIGTERM and SIGINT stop it cleanly once open transactions have ended;
// SIGUSR1 writes its state to the log and to run/vessad/state.json.
#include <signal.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

#include "base/VSACrash.h"
#include "base/VSALog.h"
#include "daemon/VSADaemon.h"
#include "daemon/VSARootChecker.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSAUserDatabase.h"

namespace {
void usage(FILE* out) {
  std::fprintf(out,
               "usage: vessad [--root DIR] [--log-level N] [--stderr] [--after-boot]\n"
               "              [--idle-exit SECONDS]\n"
               "  --root DIR      system root standing for the device's \"/\" (default /)\n"
               "  --log-level N   writer level: 3 error, 5 notice (default), 6 info, 7 debug\n"
               "  --stderr        send the unified log to stderr even when journald runs\n"
               "  --after-boot    start as the first daemon after a device boot (runs the\n"
               "                  first-boot setup and cleanup: upgrade migration, transient\n"
               "                  directories); the device's own boot does this by itself\n"
               "  --idle-exit S   under socket activation (both sockets passed by the service\n"
               "                  manager), leave after S to 2S seconds with no client,\n"
               "                  transaction or background work; the next request or upcall\n"
               "                  starts the daemon again (without activation: ignored)\n"
               "\n"
               "       vessad --verify [--root DIR] [--json]\n"
               "  checks the root while no daemon serves it, changing nothing: every class\n"
               "  directory entry is a valid container (or an orphan the next boot removes),\n"
               "  identities and UUIDs are unique, no staging or replace leftovers, pending\n"
               "  protection updates name live containers, the code-signing database is\n"
               "  sound and every application group is still referenced. Exit status:\n"
               "  0 clean, 1 findings, 2 the root cannot be read (or a daemon holds it)\n");
}

// Runs the root checker and prints its report; its status is the exit status.
int verify(const std::string& root, bool json) {
  VSALogger::shared().setLevel(kVSALogFault);  // the report says what matters
  VSARootChecker checker(root);
  auto status = checker.check();
  std::fputs((json ? checker.json() : checker.text()).c_str(), stdout);
  return status;
}
// What a root lacks that the daemon cannot serve without ("" when nothing):
// every per-user path hangs off the mobile user. Such a root is not retried,
// it is reported with the command that provisions it.
std::string missingFromRoot(const std::string& root) {
  struct stat st;
  if (::stat(root.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return "the directory does not exist";
  VSASystemRoot system(root);
  if (!VSAUserDatabase(system).userNamed("mobile"))
    return system.isHostRoot() ? "there is no user \"mobile\""
                               : "there is no user \"mobile\" in " + system.resolve("/etc/passwd");
  return "";
}
}  // namespace

int main(int argc, char** argv) {
  VSADaemon::Options options;
  bool verifyRoot = false, json = false;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--root" && i + 1 < argc) {
      options.root = argv[++i];
    } else if (a == "--log-level" && i + 1 < argc) {
      options.logLevel = std::atoi(argv[++i]);
    } else if (a == "--verify") {
      verifyRoot = true;
    } else if (a == "--json") {
      json = true;
    } else if (a == "--idle-exit" && i + 1 < argc) {
      options.idleExitSeconds = std::max(0, std::atoi(argv[++i]));
    } else if (a == "--after-boot") {
      options.afterBoot = true;
    } else if (a == "--stderr") {
      VSALogger::shared().setUseStderr(true);
    } else if (a == "--help" || a == "-h") {
      usage(stdout);
      return 0;
    } else {
      usage(stderr);
      return 2;
    }
  }
  if (verifyRoot) return verify(options.root, json);
  if (std::string missing = missingFromRoot(options.root); !missing.empty()) {
    std::fprintf(stderr,
                 "vessad: cannot serve from %s: %s; provision it with: vessactl --root %s "
                 "provision\n",
                 options.root.c_str(), missing.c_str(), options.root.c_str());
    return 78;  // EX_CONFIG: a service manager does not restart it in a loop
  }
  VSAInstallUncaughtExceptionHandler();
  // Signals are taken by one thread with sigwait; every other thread blocks them.
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGUSR1);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
  signal(SIGPIPE, SIG_IGN);
  // Whatever started the daemon, what it creates gets the modes it asks for
  // and nothing wider.
  umask(022);

  VSADaemon daemon(options);
  std::thread([&daemon, set] {
    int sig = 0;
    for (;;) {
      // With an idle period, the wait ends once a period to look for idleness.
      if (int period = daemon.idleExitSeconds(); period > 0) {
        timespec timeout{period, 0};
        sig = sigtimedwait(&set, nullptr, &timeout);
        if (sig < 0) {
          if (errno == EAGAIN && daemon.exitIfIdle()) return;
          continue;
        }
      } else if (sigwait(&set, &sig) != 0) {
        break;
      }
      if (sig != SIGUSR1) break;
      daemon.requestStateDump();
    }
    VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "main", "Received signal %d", sig);
    daemon.requestStop();
  }).detach();
  return daemon.run();
}
