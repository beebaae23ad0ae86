#include "VSALauncher.h"

#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>

#include "base/VSAJSON.h"
#include "platform/VSAAuditToken.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSALinuxPersonaService.h"
#include "platform/VSAProcessRecords.h"
#include "platform/VSAUniqueFd.h"
#include "platform/VSAUpcallClient.h"
#include "platform/VSAUserDatabase.h"
#include "upcall/VSAUpcallMessage.h"
#include "upcall/VSAUpcallPayload.h"

namespace {
// The child being waited for, for the signal handler that passes signals on.
volatile sig_atomic_t gChild = 0;

void passOn(int signal) {
  if (gChild > 0) ::kill(static_cast<pid_t>(gChild), signal);
}

constexpr uint64_t kBundleClass = 1;
}  // namespace

VSALauncher::VSALauncher(VSALaunchOptions options, VSALandlock& landlock)
    : options_(std::move(options)), landlock_(landlock), root_(options_.root) {}

int VSALauncher::fail(const std::string& step, const std::string& why) const {
  std::fprintf(stderr, "vessa-launch: %s: %s: %s\n", options_.signingIdentifier.c_str(),
               step.c_str(), why.c_str());
  return kVSALaunchFailed;
}

bool VSALauncher::resolveUser(std::string* why) {
  VSAUserDatabase users(root_);
  auto account = options_.uid ? users.userWithUID(*options_.uid) : users.userNamed("mobile");
  if (!account && options_.uid) {
    // A uid the device does not list: its own group, as for a bare uid.
    uid_ = gid_ = *options_.uid;
    return true;
  }
  if (!account) return *why = "the device has no mobile user (vessactl provision adds one)", false;
  uid_ = account->uid;
  gid_ = account->gid;
  return true;
}

bool VSALauncher::resolvePersona(std::string* why) {
  auto personas = VSALinuxPersonaService(root_).listPersonas();
  if (!personas) return *why = "the device's persona list cannot be read", false;
  for (const auto& p : *personas) {
    if (options_.personaID ? p.personaID == *options_.personaID : p.isPersonal()) {
      personaID_ = p.personaID;
      return true;
    }
  }
  *why = options_.personaID ? "no persona " + std::to_string(*options_.personaID) + " on the device"
                            : std::string("the device has no personal persona");
  return false;
}

bool VSALauncher::askForContainers(std::string* step, std::string* why) {
  VSAUpcallProcess process;
  process.codeSignatureID = options_.signingIdentifier;
  process.uid = uid_;
  process.personaID = personaID_;
  process.sandboxType = options_.plugin ? 1u : 0u;
  process.groups = options_.groups;
  process.systemContainerID = options_.systemContainer;
  process.systemGroups = options_.systemGroups;
  *step = "upcall";
  auto memory = process.pack();
  if (!memory) return *why = "the request does not fit a pack buffer", false;
  VSAUpcallRequest request;
  request.id = kVSAUpcallGetProcessContainersID;
  request.descriptorSize = request.requestSize = static_cast<uint32_t>(memory->size());
  VSAUpcallClient client;
  std::vector<uint8_t> replyBytes;
  std::optional<std::vector<uint8_t>> replyMemory;
  if (!client.connect(root_.upcallSocketPath(), why) ||
      !client.call(request.bytes(), &*memory, &replyBytes, &replyMemory, why))
    return false;
  auto reply = VSAUpcallReply::parse(replyBytes.data(), replyBytes.size());
  if (!reply) return *why = "the daemon's reply is not an upcall reply", false;
  if (reply->returnCode != 0)
    return *why = "return code " + std::to_string(reply->returnCode) +
                  (reply->returnCode == 5 ? " (is vessa-launch registered as the kernel bridge?)"
                                          : ""),
           false;
  VSAUpcallAnswer answer = replyMemory ? VSAUpcallAnswer::read(*replyMemory) : VSAUpcallAnswer{};
  if (answer.malformed) return *why = "the reply's containers are malformed", false;
  if (answer.success != 1u) return *why = "success flag 0 (see the daemon's log)", false;
  if (!answer.dataContainer || !answer.temporaryDirectory)
    return *why = "the reply names no data container", false;
  containers_.dataContainer = *answer.dataContainer;
  containers_.temporaryDirectory = *answer.temporaryDirectory;
  containers_.systemContainer = answer.systemContainer;
  containers_.groups = answer.groups;
  containers_.systemGroups = answer.systemGroups;
  return true;
}

void VSALauncher::lookUpBundle() {
  VSAIPCClient client;
  VSAErrorRef error;
  VSAValue request(VSAValue::Dictionary{{"Command", VSAValue(uint64_t{0})},
                                        {"Identifier", VSAValue(options_.signingIdentifier)},
                                        {"ContainerClass", VSAValue(kBundleClass)}});
  std::optional<VSAValue> reply;
  if (client.connect(root_.socketPath(), &error))
    reply = client.sendRequest(request, std::chrono::seconds(10), &error);
  const VSAValue* path = reply ? reply->get("ReplyPath") : nullptr;
  if (path && path->isString()) {
    containers_.bundleContainer = *path->stringValue();
  } else if (options_.verbose) {
    const VSAValue* code = reply ? reply->get("ReplyError") : nullptr;
    std::fprintf(stderr, "vessa-launch: no bundle container (%s)\n",
                 code ? ("result code " + std::to_string(code->uint64Value().value_or(0))).c_str()
                      : "no reply");
  }
}

VSAValue VSALauncher::description(const VSALaunchRules& rules) const {
  VSAValue v = VSAValue::dictionary();
  v.set("SigningIdentifier", VSAValue(options_.signingIdentifier));
  v.set("UID", VSAValue(static_cast<uint64_t>(uid_)));
  v.set("GID", VSAValue(static_cast<uint64_t>(gid_)));
  v.set("PersonaID", VSAValue(static_cast<uint64_t>(personaID_)));
  v.set("Home", VSAValue(containers_.dataContainer));
  v.set("TemporaryDirectory", VSAValue(containers_.temporaryDirectory));
  v.set("DataContainer", VSAValue(containers_.dataContainer));
  if (containers_.bundleContainer) v.set("BundleContainer", VSAValue(*containers_.bundleContainer));
  if (containers_.systemContainer) v.set("SystemContainer", VSAValue(*containers_.systemContainer));
  VSAValue groups = VSAValue::dictionary(), systemGroups = VSAValue::dictionary();
  for (const auto& [id, path] : containers_.groups) groups.set(id, VSAValue(path));
  for (const auto& [id, path] : containers_.systemGroups) systemGroups.set(id, VSAValue(path));
  v.set("GroupContainers", groups);
  v.set("SystemGroupContainers", systemGroups);
  v.set("LandlockABI", VSAValue(static_cast<int64_t>(abi_)));
  v.set("Rules", rules.description());
  return v;
}

std::optional<int> VSALauncher::confinement(const VSALaunchRules& rules) {
  std::string why;
  int ruleset = -1;
  if (abi_ < 1)
    why = std::string("Landlock is not available: ") + std::strerror(-abi_);
  else
    ruleset = rules.build(landlock_, abi_, options_.verbose, &why);
  if (ruleset >= 0) {
    if (options_.verbose) std::fprintf(stderr, "vessa-launch: Landlock ABI %d\n", abi_);
    return ruleset;
  }
  if (!options_.unconfined) {
    fail("Landlock", why + "; the app is not started (--unconfined starts it without confinement)");
    return std::nullopt;
  }
  std::fprintf(stderr, "vessa-launch: %s; starting %s UNCONFINED, as --unconfined asks\n",
               why.c_str(), options_.signingIdentifier.c_str());
  return -1;
}

int VSALauncher::run() {
  if (::geteuid() != 0)
    return fail("start", "must run as root (it records the app's process for the daemon)");
  std::string step = "user", why;
  if (!resolveUser(&why)) return fail(step, why);
  if (!resolvePersona(&why)) return fail("persona", why);
  if (!askForContainers(&step, &why)) return fail(step, why);
  lookUpBundle();
  VSALaunchRules rules(containers_, options_.allowRead, options_.allowWrite);
  abi_ = landlock_.abiVersion();
  if (options_.printRules) {
    std::printf("%s\n", VSAJSON::print(description(rules), true).c_str());
    return 0;
  }
  auto ruleset = confinement(rules);
  if (!ruleset) return kVSALaunchFailed;
  int status = startAndWait(*ruleset);
  if (*ruleset >= 0) ::close(*ruleset);
  return status;
}

void VSALauncher::becomeApp(int ruleset, int goFd) {
  char go = 0;
  ssize_t n;
  while ((n = ::read(goFd, &go, 1)) < 0 && errno == EINTR) {
  }
  if (n != 1) _exit(kVSALaunchFailed);  // the launcher could not record this process
  ::close(goFd);
  auto die = [&](const char* step) {
    std::fprintf(stderr, "vessa-launch: %s: %s: %s\n", options_.signingIdentifier.c_str(), step,
                 std::strerror(errno));
    _exit(kVSALaunchFailed);
  };
  if (::setgroups(1, &gid_) != 0 || ::setgid(gid_) != 0) die("taking the app's group");
  if (::setuid(uid_) != 0) die("taking the app's user");
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) die("no_new_privs");
  if (ruleset >= 0) {
    if (int e = landlock_.restrictSelf(ruleset)) {
      errno = -e;
      if (!options_.unconfined) die("Landlock: restricting the app");
      std::fprintf(stderr, "vessa-launch: Landlock refused (%s); running UNCONFINED\n",
                   std::strerror(errno));
    }
    ::close(ruleset);
  }
  ::setenv("HOME", containers_.dataContainer.c_str(), 1);
  ::setenv("TMPDIR", containers_.temporaryDirectory.c_str(), 1);
  if (::chdir(containers_.dataContainer.c_str()) != 0) die("changing to the data container");
  std::vector<char*> argv;
  for (auto& a : options_.program) argv.push_back(a.data());
  argv.push_back(nullptr);
  ::execvp(argv[0], argv.data());
  int e = errno;
  std::fprintf(stderr, "vessa-launch: %s: %s\n", argv[0], std::strerror(e));
  _exit(e == ENOENT ? kVSALaunchNotFound : kVSALaunchCannotExecute);
}

int VSALauncher::startAndWait(int ruleset) {
  int go[2];
  if (::pipe2(go, O_CLOEXEC) != 0) return fail("start", std::strerror(errno));
  struct sigaction forward = {};
  forward.sa_handler = passOn;
  sigemptyset(&forward.sa_mask);
  for (int s : {SIGINT, SIGTERM, SIGHUP}) ::sigaction(s, &forward, nullptr);
  std::fflush(nullptr);
  pid_t pid = ::fork();
  if (pid < 0) return fail("start", std::strerror(errno));
  if (pid == 0) {
    ::close(go[1]);
    becomeApp(ruleset, go[0]);
  }
  gChild = pid;
  ::close(go[0]);
  VSAUniqueFd goFd(go[1]);
  uint64_t startTime = VSAAuditToken::processStartTime(pid);
  VSAProcessRecords records(root_);
  int e = startTime ? records.write(VSAProcessRecordKind::Persona, pid, startTime,
                                    std::to_string(personaID_))
                    : ESRCH;
  if (!e)
    e = records.write(VSAProcessRecordKind::SigningIdentifier, pid, startTime,
                      options_.signingIdentifier);
  if (e || ::write(goFd.get(), "g", 1) != 1) {
    int status;
    goFd.reset();
    ::kill(pid, SIGKILL);
    ::waitpid(pid, &status, 0);
    removeRecords(pid, startTime);
    return fail("records", std::string("recording the process for the daemon: ") +
                               std::strerror(e ? e : errno));
  }
  goFd.reset();
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  gChild = 0;
  removeRecords(pid, startTime);
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return kVSALaunchFailed;
}

void VSALauncher::removeRecords(pid_t pid, uint64_t startTime) const {
  VSAProcessRecords records(root_);
  records.remove(VSAProcessRecordKind::Persona, pid, startTime);
  records.remove(VSAProcessRecordKind::SigningIdentifier, pid, startTime);
}
