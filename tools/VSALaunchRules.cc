#include "VSALaunchRules.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "platform/VSAUniqueFd.h"

using Access = VSALaunchRule::Access;
namespace LA = VSALandlockAccess;

const std::vector<std::string>& VSALaunchRules::systemDirectories() {
  static const std::vector<std::string> dirs = {"/usr",   "/bin",    "/sbin", "/lib", "/lib32",
                                                "/lib64", "/libx32", "/etc",  "/opt"};
  return dirs;
}

const std::vector<std::string>& VSALaunchRules::deviceFiles() {
  static const std::vector<std::string> files = {"/dev/null",   "/dev/zero",    "/dev/full",
                                                 "/dev/random", "/dev/urandom", "/dev/tty"};
  return files;
}

VSALaunchRules::VSALaunchRules(const VSALaunchContainers& c,
                               const std::vector<std::string>& allowRead,
                               const std::vector<std::string>& allowWrite) {
  add(c.dataContainer, Access::ReadWrite, false);
  for (const auto& [id, path] : c.groups) add(path, Access::ReadWrite, false);
  if (c.systemContainer) add(*c.systemContainer, Access::ReadWrite, false);
  for (const auto& [id, path] : c.systemGroups) add(path, Access::ReadWrite, false);
  for (const auto& path : allowWrite) add(path, Access::ReadWrite, false);
  for (const auto& dir : systemDirectories()) add(dir, Access::ReadExecute, true);
  if (c.bundleContainer) add(*c.bundleContainer, Access::ReadExecute, false);
  // What programs read of themselves (/proc/self); another process's entries
  // that matter (its memory, environment, descriptors, working directory)
  // are closed to a process in another Landlock domain by the kernel.
  add("/proc", Access::Read, true);
  for (const auto& path : allowRead) add(path, Access::Read, false);
  for (const auto& file : deviceFiles()) add(file, Access::Device, true);
  for (int fd : {0, 1, 2}) {
    char name[256];
    if (isatty(fd) && ttyname_r(fd, name, sizeof name) == 0) add(name, Access::Device, true);
  }
}

void VSALaunchRules::add(const std::string& path, Access access, bool optional) {
  for (const auto& r : rules_)
    if (r.path == path && r.access == access) return;
  rules_.push_back({path, access, optional});
}

uint64_t VSALaunchRules::rights(Access access, int abi, bool directory) {
  uint64_t handled = LA::handledBy(abi), granted = 0;
  switch (access) {
    case Access::ReadWrite:
      granted = handled & ~LA::kExecute;
      break;
    case Access::ReadExecute:
      granted = LA::kExecute | LA::kReadFile | LA::kReadDir;
      break;
    case Access::Read:
      granted = LA::kReadFile | LA::kReadDir;
      break;
    case Access::Device:
      granted = LA::kReadFile | LA::kWriteFile | LA::kTruncate | LA::kIoctlDev;
      break;
  }
  granted &= handled;
  return directory ? granted : granted & LA::kFileRights;
}

const char* VSALaunchRules::name(Access access) {
  switch (access) {
    case Access::ReadWrite:
      return "read-write";
    case Access::ReadExecute:
      return "read-execute";
    case Access::Read:
      return "read";
    case Access::Device:
      return "device";
  }
  return "?";
}

VSAValue VSALaunchRules::description() const {
  VSAValue list = VSAValue::array();
  for (const auto& r : rules_)
    list.mutableArray()->push_back(VSAValue(
        VSAValue::Dictionary{{"Path", VSAValue(r.path)}, {"Access", VSAValue(name(r.access))}}));
  return list;
}

int VSALaunchRules::build(VSALandlock& landlock, int abi, bool verbose, std::string* why) const {
  int ruleset = landlock.createRuleset(LA::handledBy(abi), abi);
  if (ruleset < 0) {
    *why = std::string("Landlock: creating the ruleset: ") + std::strerror(-ruleset);
    return -1;
  }
  VSAUniqueFd owned(ruleset);
  for (const auto& r : rules_) {
    VSAUniqueFd fd(::open(r.path.c_str(), O_PATH | O_CLOEXEC));
    struct stat st;
    if (fd.get() < 0 || fstat(fd.get(), &st) != 0) {
      if (r.optional && errno == ENOENT) continue;
      *why = "Landlock: " + r.path + ": " + std::strerror(errno);
      return -1;
    }
    uint64_t access = rights(r.access, abi, S_ISDIR(st.st_mode));
    if (int e = landlock.allowBeneath(ruleset, fd.get(), access)) {
      *why = "Landlock: adding a rule for " + r.path + ": " + std::strerror(-e);
      return -1;
    }
    if (verbose) std::fprintf(stderr, "vessa-launch: %-12s %s\n", name(r.access), r.path.c_str());
  }
  return owned.release();
}
