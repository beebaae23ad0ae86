#include "VSALauncher.h"

#include <fcntl.h>
#include <grp.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
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

bool VSALauncher::askForContainers(VSAUpcallClient& client, std::string* step, std::string* why) {
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
  std::vector<uint8_t> replyBytes;
  std::optional<std::vector<uint8_t>> replyMemory;
  if (!client.isConnected()) return *why = "cannot connect to the daemon's upcall socket", false;
  if (!client.call(request.bytes(), &*memory, &replyBytes, &replyMemory, why)) return false;
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

std::optional<uint64_t> VSALauncher::askForBundle(VSAIPCClient& client) const {
  VSAErrorRef error;
  VSAValue request(
      VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kCreateOrLookup)},
                           {"Identifier", VSAValue(options_.signingIdentifier)},
                           {"ContainerClass", VSAValue(VSAClass::kBundleApplication)}});
  if (!client.connect(root_.socketPath(), &error)) return std::nullopt;
  return client.send(std::move(request), &error);
}

void VSALauncher::receiveBundle(VSAIPCClient& client, std::optional<uint64_t> messageID) {
  VSAErrorRef error;
  std::optional<VSAValue> reply;
  if (messageID) reply = client.waitForReply(*messageID, std::chrono::seconds(10), &error);
  client.close();
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
  // The daemon identifies a peer as it accepts the connection, and answers
  // the upcall and the bundle look-up on different threads: both
  // connections are made, and the look-up sent, before the launcher reads
  // the device's users and personas, which the upcall needs.
  VSAUpcallClient upcallClient;
  std::string upcallWhy;
  (void)upcallClient.connect(root_.upcallSocketPath(), &upcallWhy);
  VSAIPCClient bundleClient;
  auto bundleRequest = askForBundle(bundleClient);
  if (!resolveUser(&why)) return fail(step, why);
  if (!resolvePersona(&why)) return fail("persona", why);
  if (!upcallClient.isConnected()) return fail("upcall", upcallWhy);
  if (!askForContainers(upcallClient, &step, &why)) return fail(step, why);
  receiveBundle(bundleClient, bundleRequest);
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

namespace {
// What the child needs between clone and exec, all made beforehand: it
// shares the launcher's memory and may not allocate.
struct VSALaunchChild {
  const VSAOwnProcessRecord* records[2];
  uid_t uid;
  gid_t gid;
  int ruleset;
  bool unconfined;
  VSALandlock* landlock;
  const char* home;
  char* const* argv;
  char* const* envp;
  const char* prefix;  // "vessa-launch: <signing identifier>: "
};

void say(const char* text) {
  for (size_t length = std::strlen(text); length > 0;) {
    ssize_t n = ::write(2, text, length);
    if (n <= 0) return;
    text += n;
    length -= static_cast<size_t>(n);
  }
}

[[noreturn]] void childFails(const VSALaunchChild& c, const char* step, int error, int status) {
  say(c.prefix);
  say(step);
  say(": ");
  say(std::strerror(error));
  say("\n");
  _exit(status);
}

// The child: records itself for the daemon while it is still root, then
// takes the app's user, no_new_privs and the ruleset, and execs. Signals the
// launcher passes on keep their default action here.
int becomeApp(void* argument) {
  const auto& c = *static_cast<const VSALaunchChild*>(argument);
  struct sigaction byDefault = {};
  byDefault.sa_handler = SIG_DFL;
  sigset_t passed;
  sigemptyset(&passed);
  for (int s : {SIGINT, SIGTERM, SIGHUP}) {
    ::sigaction(s, &byDefault, nullptr);
    sigaddset(&passed, s);
  }
  ::sigprocmask(SIG_UNBLOCK, &passed, nullptr);
  for (const VSAOwnProcessRecord* record : c.records)
    if (int e = record->writeForSelf())
      childFails(c, "records: recording the process for the daemon", e, kVSALaunchFailed);
  if (::setgroups(1, &c.gid) != 0 || ::setgid(c.gid) != 0)
    childFails(c, "taking the app's group", errno, kVSALaunchFailed);
  if (::setuid(c.uid) != 0) childFails(c, "taking the app's user", errno, kVSALaunchFailed);
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0)
    childFails(c, "no_new_privs", errno, kVSALaunchFailed);
  if (c.ruleset >= 0) {
    if (int e = c.landlock->restrictSelf(c.ruleset)) {
      if (!c.unconfined) childFails(c, "Landlock: restricting the app", -e, kVSALaunchFailed);
      say(c.prefix);
      say("Landlock refused; running UNCONFINED\n");
    }
  }
  if (::chdir(c.home) != 0)
    childFails(c, "changing to the data container", errno, kVSALaunchFailed);
  ::execvpe(c.argv[0], c.argv, c.envp);
  int e = errno;
  childFails(c, c.argv[0], e, e == ENOENT ? kVSALaunchNotFound : kVSALaunchCannotExecute);
}

// The caller's environment with HOME and TMPDIR set for the app.
std::vector<std::string> appEnvironment(const VSALaunchContainers& containers) {
  std::vector<std::string> out;
  for (char** e = environ; *e; ++e)
    if (std::strncmp(*e, "HOME=", 5) != 0 && std::strncmp(*e, "TMPDIR=", 7) != 0)
      out.emplace_back(*e);
  out.push_back("HOME=" + containers.dataContainer);
  out.push_back("TMPDIR=" + containers.temporaryDirectory);
  return out;
}

std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> out;
  for (auto& s : strings) out.push_back(s.data());
  out.push_back(nullptr);
  return out;
}

constexpr size_t kVSAChildStackSize = 256 * 1024;
}  // namespace

int VSALauncher::startAndWait(int ruleset) {
  VSAProcessRecords records(root_);
  VSAOwnProcessRecord persona, signing;
  int e = persona.prepare(records, VSAProcessRecordKind::Persona, std::to_string(personaID_));
  if (!e)
    e = signing.prepare(records, VSAProcessRecordKind::SigningIdentifier,
                        options_.signingIdentifier);
  if (e)
    return fail("records",
                std::string("recording the process for the daemon: ") + std::strerror(e));
  std::vector<std::string> arguments = options_.program, environment = appEnvironment(containers_);
  std::vector<char*> argv = pointers(arguments), envp = pointers(environment);
  std::string prefix = "vessa-launch: " + options_.signingIdentifier + ": ";
  VSALaunchChild child{{&persona, &signing},
                       uid_,
                       gid_,
                       ruleset,
                       options_.unconfined,
                       &landlock_,
                       containers_.dataContainer.c_str(),
                       argv.data(),
                       envp.data(),
                       prefix.c_str()};
  void* stack = ::mmap(nullptr, kVSAChildStackSize, PROT_READ | PROT_WRITE,
                       MAP_PRIVATE | MAP_ANONYMOUS | MAP_STACK, -1, 0);
  if (stack == MAP_FAILED) return fail("start", std::strerror(errno));
  // The signals passed on are held until the child's pid is known, so that
  // none is lost in between; the child takes them with their default action.
  struct sigaction forward = {};
  forward.sa_handler = passOn;
  sigemptyset(&forward.sa_mask);
  sigset_t passed, before;
  sigemptyset(&passed);
  for (int s : {SIGINT, SIGTERM, SIGHUP}) {
    ::sigaction(s, &forward, nullptr);
    sigaddset(&passed, s);
  }
  ::sigprocmask(SIG_BLOCK, &passed, &before);
#ifndef VESSA_SANITIZED
  // CLONE_VM | CLONE_VFORK: no copy of the launcher's memory is made, and
  // the launcher goes on once the child has exec'd (or failed).
  pid_t pid = ::clone(becomeApp, static_cast<char*>(stack) + kVSAChildStackSize,
                      CLONE_VM | CLONE_VFORK | SIGCHLD, &child);
#else
  pid_t pid = ::fork();
  if (pid == 0) _exit(becomeApp(&child));
#endif
  int cloneError = errno;
  ::munmap(stack, kVSAChildStackSize);
  if (pid > 0) gChild = pid;
  ::sigprocmask(SIG_SETMASK, &before, nullptr);
  if (pid < 0) return fail("start", std::strerror(cloneError));
  // The records go before the child is reaped, while its pid is still its own.
  siginfo_t ended;
  while (::waitid(P_PID, static_cast<id_t>(pid), &ended, WEXITED | WNOWAIT) < 0 && errno == EINTR) {
  }
  persona.removeForUnreapedChild(pid);
  signing.removeForUnreapedChild(pid);
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  gChild = 0;
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return kVSALaunchFailed;
}
