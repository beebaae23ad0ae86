#include "e2e/VSATestDaemon.h"

#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

#include "base/VSACommands.h"
#include "base/VSAPlist.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSANamedSemaphore.h"
#include "platform/VSANotificationCenter.h"
#include "platform/VSASystemRoot.h"

namespace fs = std::filesystem;
using namespace std::chrono_literals;

VSATestDaemon::VSATestDaemon() {
  char tmpl[] = "/tmp/vessa-e2e-XXXXXX";
  root_ = mkdtemp(tmpl);
  fs::create_directories(root_ + "/etc/vessad/clients.d");
  fs::create_directories(root_ + "/usr/bin");
  fs::create_directories(root_ + "/run/vessad");
  fs::create_directories(root_ + "/private/var/mobile");
  std::ofstream(root_ + "/etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                          "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n";
  std::ofstream(root_ + "/etc/group") << "root:x:0:\nmobile:x:501:\nsystemusers:x:600:\n";
}

VSATestDaemon::~VSATestDaemon() {
  if (pid_ > 0) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  VSANamedSemaphore::remove(firstBootSemaphore());
  fs::remove_all(root_);
}

std::string VSATestDaemon::firstBootSemaphore() const {
  return VSANamedSemaphore::nameForRoot("vessad.fb_check", VSASystemRoot(root_));
}

namespace {
void writeEntry(const std::string& file, const std::string& exe, const std::string& sid,
                const VSAValue& entitlements, bool sandboxed, bool kernelBridge = false) {
  VSAErrorRef error;
  VSA_writeToURL(VSAValue::Dictionary{{"Executable", VSAValue(exe)},
                                      {"SigningIdentifier", VSAValue(sid)},
                                      {"Entitlements", entitlements},
                                      {"Sandboxed", VSAValue(sandboxed)},
                                      {"KernelBridge", VSAValue(kernelBridge)}},
                 file, 0, &error);
}
}  // namespace

void VSATestDaemon::registerSelf(const std::string& signingIdentifier, const VSAValue& entitlements,
                                 bool sandboxed) {
  char buf[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
  fs::remove(root_ + "/usr/bin/e2e-tests");
  fs::create_symlink(std::string(buf, n), root_ + "/usr/bin/e2e-tests");
  writeEntry(root_ + "/etc/vessad/clients.d/e2e-tests.plist", "/usr/bin/e2e-tests",
             signingIdentifier, entitlements, sandboxed);
}

void VSATestDaemon::registerUpcallTool() {
  fs::copy_file(VESSA_UPCALL_PATH, root_ + "/usr/bin/vessa-upcall",
                fs::copy_options::overwrite_existing);
  writeEntry(root_ + "/etc/vessad/clients.d/vessa-upcall.plist", "/usr/bin/vessa-upcall",
             "com.tamsk.kernel.sandbox-bridge", VSAValue::dictionary(), false, true);
}

void VSATestDaemon::writePersonas(const std::string& enterpriseApp) const {
  VSAValue personas = VSAValue::Array{
      VSAValue::Dictionary{{"PersonaID", VSAValue(1000u)},
                           {"Kind", VSAValue("personal")},
                           {"UniqueString", VSAValue("PERSONAL-1000")}},
      VSAValue::Dictionary{
          {"PersonaID", VSAValue(1001u)},
          {"Kind", VSAValue("enterprise")},
          {"UniqueString", VSAValue("WORK-1001")},
          {"LayoutPath", VSAValue("/private/var/enterprise/1001")},
          {"BundleIdentifiers", VSAValue(VSAValue::Array{VSAValue(enterpriseApp)})}}};
  fs::create_directories(path("/private/var/enterprise/1001"));
  auto bytes = VSAPlist::serialize(personas, VSAPlist::Format::XML, nullptr);
  std::ofstream(path("/etc/vessad/personas.plist"), std::ios::binary)
      .write(reinterpret_cast<const char*>(bytes->data()), bytes->size());
}

void VSATestDaemon::registerLaunchTool() {
  fs::copy_file(VESSA_LAUNCH_PATH, root_ + "/usr/bin/vessa-launch",
                fs::copy_options::overwrite_existing);
  writeEntry(root_ + "/etc/vessad/clients.d/vessa-launch.plist", "/usr/bin/vessa-launch",
             "com.tamsk.kernel.sandbox-bridge",
             VSAValue::Dictionary{{"com.tamsk.private.Vessa.otherIdLookup", VSAValue(true)}}, false,
             true);
}

void VSATestDaemon::registerSelfAsKernelBridge() {
  registerSelf("com.tamsk.kernel.sandbox-bridge", VSAValue::dictionary());
  writeEntry(root_ + "/etc/vessad/clients.d/e2e-tests.plist", "/usr/bin/e2e-tests",
             "com.tamsk.kernel.sandbox-bridge", VSAValue::dictionary(), false, true);
}

void VSATestDaemon::registerVessactl(const std::string& name, const std::string& signingIdentifier,
                                     const VSAValue& entitlements) {
  fs::copy_file(VESSACTL_PATH, root_ + "/usr/bin/" + name, fs::copy_options::overwrite_existing);
  writeEntry(root_ + "/etc/vessad/clients.d/" + name + ".plist", "/usr/bin/" + name,
             signingIdentifier, entitlements, false);
}

bool VSATestDaemon::start(bool waitForSocket, std::vector<std::string> extraArgs) {
  std::vector<std::string> args = prefix_;
  for (const char* a : {VESSAD_PATH, "--root", root_.c_str(), "--stderr", "--log-level", "7"})
    args.push_back(a);
  args.insert(args.end(), extraArgs.begin(), extraArgs.end());
  pid_ = fork();
  if (pid_ == 0) {
    int out = open((root_ + "/vessad.out").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    dup2(out, 1);
    dup2(out, 2);
    if (!activationFds_.empty()) {
      // Above every descriptor they might be moved onto, then into place from 3.
      std::vector<int> high;
      for (int fd : activationFds_) high.push_back(fcntl(fd, F_DUPFD, 100));
      for (size_t i = 0; i < high.size(); ++i) dup2(high[i], 3 + static_cast<int>(i));
      setenv("LISTEN_FDS", std::to_string(high.size()).c_str(), 1);
      setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
    }
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    execv(argv[0], argv.data());
    _exit(127);
  }
  if (!waitForSocket) return pid_ > 0;
  for (int i = 0; i < 1000; ++i) {
    VSAIPCClient probe;
    if (probe.connect(socketPath(), nullptr)) {
      // Both sockets take connections before initialisation; a request is
      // answered only after it, so one answer says that start-up is over
      // (the retired command 27, which changes nothing). A start held on
      // purpose is given up on after ten seconds.
      VSAErrorRef error;
      probe.sendRequest(VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kRetired)}}, 10s,
                        &error);
      return true;
    }
    std::this_thread::sleep_for(10ms);
  }
  return false;
}

int VSATestDaemon::stop(std::chrono::seconds timeout) {
  if (pid_ <= 0) return -1;
  kill(pid_, SIGTERM);
  auto deadline = std::chrono::steady_clock::now() + timeout;
  int status = 0;
  while (std::chrono::steady_clock::now() < deadline) {
    pid_t r = waitpid(pid_, &status, WNOHANG);
    if (r == pid_) {
      pid_ = -1;
      return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }
    std::this_thread::sleep_for(10ms);
  }
  kill(pid_, SIGKILL);
  waitpid(pid_, nullptr, 0);
  pid_ = -1;
  return -1;
}

void VSATestDaemon::crash() {
  if (pid_ <= 0) return;
  kill(pid_, SIGKILL);
  waitpid(pid_, nullptr, 0);
  pid_ = -1;
}

bool VSATestDaemon::waitForExit(std::chrono::seconds timeout, int* status) {
  if (pid_ <= 0) return false;
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    if (waitpid(pid_, status, WNOHANG) == pid_) {
      pid_ = -1;
      return true;
    }
    std::this_thread::sleep_for(10ms);
  }
  return false;
}

std::optional<VSAValue> VSATestDaemon::request(VSAValue body, std::chrono::milliseconds timeout) {
  VSAIPCClient client;
  if (!client.connect(socketPath(), nullptr)) return std::nullopt;
  return client.sendRequest(std::move(body), timeout, nullptr);
}

VSATestDaemon::Run VSATestDaemon::vessactl(const std::string& client,
                                           std::vector<std::string> args) {
  std::string exe = client.empty() ? std::string(VESSACTL_PATH) : root_ + "/usr/bin/" + client;
  std::vector<std::string> full = {exe, "--root", root_};
  full.insert(full.end(), args.begin(), args.end());
  return run(std::move(full));
}

VSATestDaemon::Run VSATestDaemon::verify(bool json) const {
  std::vector<std::string> full = {VESSAD_PATH, "--verify", "--root", root_};
  if (json) full.push_back("--json");
  return run(std::move(full));
}

VSATestDaemon::Run VSATestDaemon::run(std::vector<std::string> full) {
  int pipefd[2];
  if (pipe(pipefd) != 0) return {-1, ""};
  pid_t pid = fork();
  if (pid == 0) {
    dup2(pipefd[1], 1);
    dup2(pipefd[1], 2);
    close(pipefd[0]);
    std::vector<char*> argv;
    for (auto& a : full) argv.push_back(a.data());
    argv.push_back(nullptr);
    execv(argv[0], argv.data());
    _exit(127);
  }
  close(pipefd[1]);
  std::string out;
  char buf[4096];
  ssize_t n;
  while ((n = read(pipefd[0], buf, sizeof buf)) > 0) out.append(buf, n);
  close(pipefd[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, out};
}

std::vector<std::string> VSATestDaemon::notifications() const {
  return VSANotificationCenter(VSASystemRoot(root_)).postedNames();
}

bool VSATestDaemon::waitForNotifications(size_t count, std::chrono::seconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    if (notifications().size() >= count) return true;
    std::this_thread::sleep_for(10ms);
  }
  return false;
}

std::string VSATestDaemon::daemonOutput() const {
  std::ifstream in(root_ + "/vessad.out");
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

VSAInitialisationHold::VSAInitialisationHold(const std::string& root) {
  std::string dir = root + "/private/var/root/Library/Logs/Vessa";
  fs::create_directories(dir);
  fifo_ = dir + "/vessad.log";
  if (mkfifo(fifo_.c_str(), 0644) != 0) throw std::runtime_error("mkfifo failed");
}

void VSAInitialisationHold::release() {
  if (reader_.joinable()) return;
  reader_ = std::thread([this] {
    int fd = open(fifo_.c_str(), O_RDONLY | O_NONBLOCK);
    char buf[4096];
    while (!stop_)
      if (read(fd, buf, sizeof buf) <= 0) std::this_thread::sleep_for(2ms);
    close(fd);
  });
}

VSAInitialisationHold::~VSAInitialisationHold() {
  stop_ = true;
  if (reader_.joinable()) reader_.join();
}

VSATestDaemon::Run VSARunAsMobileUser(const std::function<int()>& body) {
  int out[2];
  if (pipe(out) != 0) return {-1, ""};
  pid_t pid = fork();
  if (pid == 0) {
    dup2(out[1], 1);
    close(out[0]);
    if (setgroups(0, nullptr) != 0 || setgid(501) != 0 || setuid(501) != 0) _exit(100);
    _exit(body());
  }
  close(out[1]);
  std::string text;
  char buf[4096];
  for (ssize_t n; (n = read(out[0], buf, sizeof buf)) > 0;) text.append(buf, n);
  close(out[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, text};
}
