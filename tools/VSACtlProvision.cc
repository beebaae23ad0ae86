#include "VSACtlProvision.h"

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "base/VSAPlist.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSAUserDatabase.h"

namespace fs = std::filesystem;

namespace {

struct Settings {
  std::string mobileUser = "mobile";
  uid_t mobileUID = 501;
  bool force = false;
};

// The entitlements of the administrator's client: every command.
VSAValue administratorEntitlements() {
  VSAValue::Dictionary d;
  for (const char* name :
       {"allowed", "lookup", "otherIdLookup", "wipeContainer", "testability", "userManagedAssets",
        "deleteContainerContent", "dataMigration", "stageSharedContent"})
    d.emplace(std::string("com.tamsk.private.Vessa.") + name, VSAValue(true));
  return VSAValue(std::move(d));
}

class Provisioner {
 public:
  Provisioner(std::string root, Settings settings)
      : root_(root == "/" ? root : fs::absolute(root).lexically_normal().string()),
        system_(root_),
        settings_(std::move(settings)) {}

  int run() {
    if (::geteuid() != 0) say("warning: not root; the daemon trusts only root-owned files");
    for (const char* dir : {"/etc/vessad/clients.d", "/run/vessad", "/tmp", "/private/var/root"})
      fs::create_directories(system_.resolve(dir), ec_);
    ensureUsers();
    writePlist("/etc/vessad/device.plist", VSAValue::dictionary());
    writePlist("/etc/vessad/personas.plist", VSAValue(VSAValue::Array{VSAValue(VSAValue::Dictionary{
                                                 {"PersonaID", VSAValue(uint64_t{1000})},
                                                 {"Kind", VSAValue("personal")},
                                                 {"UniqueString", VSAValue("PERSONAL-1000")}})}));
    writePlist("/etc/vessad/system-version.plist",
               VSAValue::Dictionary{{"BuildVersion", VSAValue(buildVersion())},
                                    {"ReleaseType", VSAValue("User")}});
    registerClients();
    auto mobile = VSAUserDatabase(system_).userNamed(settings_.mobileUser);
    if (!mobile) {
      std::fprintf(stderr, "vessactl provision: %s still has no user \"%s\"\n", root_.c_str(),
                   settings_.mobileUser.c_str());
      return 1;
    }
    std::string home = mobile->homeDirectory;
    if (!fs::exists(home)) {
      fs::create_directories(home, ec_);
      if (::chown(home.c_str(), mobile->uid, mobile->gid) != 0) failed_ = true;
    }
    std::printf("provisioned %s%s\n", root_.c_str(), failed_ ? " (with errors)" : "");
    return failed_ ? 1 : 0;
  }

 private:
  void say(const std::string& line) { std::printf("  %s\n", line.c_str()); }

  // Whether `devicePath` may be written: absent, or --force.
  bool mayWrite(const std::string& devicePath) {
    if (!fs::exists(system_.resolve(devicePath))) return true;
    if (settings_.force) return true;
    say("kept " + devicePath + " (exists; --force replaces it)");
    return false;
  }

  void writeText(const std::string& devicePath, const std::string& text, mode_t mode) {
    std::string path = system_.resolve(devicePath);
    std::string temporary = path + ".provision";
    {
      std::ofstream out(temporary, std::ios::trunc);
      out << text;
      out.flush();
      if (!out) return fail("could not write " + devicePath);
    }
    ::chmod(temporary.c_str(), mode);
    if (::rename(temporary.c_str(), path.c_str()) != 0)
      return fail("could not write " + devicePath);
    say("wrote " + devicePath);
  }

  void writePlist(const std::string& devicePath, const VSAValue& value) {
    if (!mayWrite(devicePath)) return;
    VSAErrorRef error;
    if (!VSA_writeToURL(value, system_.resolve(devicePath), 0, &error))
      return fail("could not write " + devicePath + ": " + error->localizedDescription());
    say("wrote " + devicePath);
  }

  void fail(const std::string& why) {
    std::fprintf(stderr, "vessactl provision: %s\n", why.c_str());
    failed_ = true;
  }

  void ensureUsers() {
    VSAUserDatabase users(system_);
    if (system_.isHostRoot()) {
      if (!users.groupNamed("systemusers")) runTool({"groupadd", "--system", "systemusers"});
      if (!users.userNamed(settings_.mobileUser))
        runTool({"useradd", "--uid", std::to_string(settings_.mobileUID), "--user-group",
                 "--home-dir", "/private/var/mobile", "--shell", "/usr/sbin/nologin",
                 settings_.mobileUser});
      return;
    }
    std::string uid = std::to_string(settings_.mobileUID);
    if (mayWrite("/etc/passwd"))
      writeText("/etc/passwd",
                "root:x:0:0:root:/private/var/root:/bin/sh\n" + settings_.mobileUser + ":x:" + uid +
                    ":" + uid + ":Mobile User:/private/var/mobile:/bin/sh\n",
                0644);
    if (mayWrite("/etc/group"))
      writeText("/etc/group",
                "root:x:0:\n" + settings_.mobileUser + ":x:" + uid + ":\nsystemusers:x:600:\n",
                0644);
  }

  void runTool(const std::vector<std::string>& argv) {
    std::string line;
    for (const auto& a : argv) line += (line.empty() ? "" : " ") + a;
    say("running " + line);
    pid_t child = ::fork();
    if (child == 0) {
      std::vector<char*> args;
      for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
      args.push_back(nullptr);
      ::execvp(args[0], args.data());
      ::_exit(127);
    }
    int status = -1;
    if (child < 0 || ::waitpid(child, &status, 0) != child || !WIFEXITED(status) ||
        WEXITSTATUS(status) != 0)
      fail(line + " failed");
  }

  // The device's build: its os-release entry when it has one.
  std::string buildVersion() {
    std::ifstream release(system_.resolve("/etc/os-release"));
    std::string line, id, version;
    while (std::getline(release, line)) {
      auto value = [&](const char* key) {
        std::string v = line.substr(std::string(key).size());
        if (v.size() >= 2 && v.front() == '"' && v.back() == '"') v = v.substr(1, v.size() - 2);
        return v;
      };
      if (line.rfind("ID=", 0) == 0) id = value("ID=");
      if (line.rfind("VERSION_ID=", 0) == 0) version = value("VERSION_ID=");
    }
    return id.empty() ? "1" : id + "-" + (version.empty() ? "rolling" : version);
  }

  // The program's path on the device: itself on "/", a root-owned copy in
  // /usr/bin below any other root.
  std::string install(const std::string& hostPath, const std::string& name) {
    if (system_.isHostRoot()) return hostPath;
    std::string devicePath = "/usr/bin/" + name;
    std::string target = system_.resolve(devicePath);
    fs::create_directories(fs::path(target).parent_path(), ec_);
    fs::copy_file(hostPath, target, fs::copy_options::overwrite_existing, ec_);
    if (ec_ || ::chown(target.c_str(), 0, 0) != 0 || ::chmod(target.c_str(), 0755) != 0) {
      fail("could not install " + devicePath);
      ec_.clear();
    }
    ::chmod(fs::path(target).parent_path().c_str(), 0755);
    return devicePath;
  }

  void registerClient(const std::string& file, const std::string& executable,
                      const std::string& signingIdentifier, VSAValue entitlements,
                      bool kernelBridge) {
    std::string devicePath = "/etc/vessad/clients.d/" + file;
    if (!mayWrite(devicePath)) return;
    VSAValue entry = VSAValue::Dictionary{{"Executable", VSAValue(executable)},
                                          {"SigningIdentifier", VSAValue(signingIdentifier)},
                                          {"Entitlements", std::move(entitlements)},
                                          {"Sandboxed", VSAValue(false)},
                                          {"KernelBridge", VSAValue(kernelBridge)},
                                          {"User", VSAValue(uint64_t{0})}};
    writePlist(devicePath, entry);
    ::chmod(system_.resolve(devicePath).c_str(), 0644);
  }

  void registerClients() {
    char self[PATH_MAX];
    ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
    if (n <= 0) return fail("cannot find this program's own path");
    fs::path me(std::string(self, static_cast<size_t>(n)));
    registerClient("vessactl.plist", install(me.string(), "vessactl"), "com.tamsk.vessactl",
                   administratorEntitlements(), false);
    // The launcher also looks up the bundle container of the app it starts.
    VSAValue launcher =
        VSAValue::Dictionary{{"com.tamsk.private.Vessa.otherIdLookup", VSAValue(true)}};
    for (auto [bridge, entitlements] :
         {std::pair{"vessa-upcall", VSAValue::dictionary()}, std::pair{"vessa-launch", launcher}}) {
      fs::path beside = me.parent_path() / bridge;
      if (::access(beside.c_str(), X_OK) != 0) continue;
      registerClient(std::string(bridge) + ".plist", install(beside.string(), bridge),
                     "com.tamsk.kernel.sandbox-bridge", entitlements, true);
    }
  }

  std::string root_;
  VSASystemRoot system_;
  Settings settings_;
  std::error_code ec_;
  bool failed_ = false;
};

}  // namespace

const char* VSACtlProvision::help() {
  return "usage: vessactl [--root DIR] provision [--mobile-user NAME] [--mobile-uid N] [--force]\n"
         "  writes the least a system root needs before vessad serves from it: the mobile\n"
         "  user (etc/passwd and etc/group below DIR; useradd on /), etc/vessad/device.plist,\n"
         "  personas.plist (one personal persona), system-version.plist, and the client\n"
         "  registry: this vessactl as root's full client, vessa-upcall and vessa-launch\n"
         "  (when beside it) as the kernel bridge. Existing files are kept unless --force.\n"
         "  Run as root. Exit status 0 provisioned, 1 something could not be written.\n";
}

int VSACtlProvision::run(const std::string& root, const std::vector<std::string>& arguments) {
  Settings settings;
  for (size_t i = 0; i < arguments.size(); ++i) {
    const std::string& a = arguments[i];
    bool hasValue = i + 1 < arguments.size();
    if (a == "--force") {
      settings.force = true;
    } else if (a == "--mobile-user" && hasValue) {
      settings.mobileUser = arguments[++i];
    } else if (a == "--mobile-uid" && hasValue) {
      char* end = nullptr;
      unsigned long uid = std::strtoul(arguments[i + 1].c_str(), &end, 10);
      if (*end || arguments[i + 1].empty() || uid == 0 || uid >= 65534) {
        std::fprintf(stderr, "vessactl provision: --mobile-uid must be 1-65533\n%s", help());
        return 2;
      }
      settings.mobileUID = static_cast<uid_t>(uid);
      ++i;
    } else {
      std::fprintf(stderr, "vessactl provision: unexpected %s\n%s", a.c_str(), help());
      return 2;
    }
  }
  if (settings.mobileUser.empty() ||
      settings.mobileUser.find_first_of(":/\n") != std::string::npos) {
    std::fprintf(stderr, "vessactl provision: invalid user name\n");
    return 2;
  }
  return Provisioner(root, settings).run();
}
