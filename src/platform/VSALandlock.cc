#include "platform/VSALandlock.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

namespace {
#ifndef SYS_landlock_create_ruleset
constexpr long SYS_landlock_create_ruleset = 444;
constexpr long SYS_landlock_add_rule = 445;
constexpr long SYS_landlock_restrict_self = 446;
#endif
constexpr unsigned kCreateRulesetVersion = 1U << 0;
constexpr int kRulePathBeneath = 1;

// The kernel's structures, as of ABI 6 (fields added at the end; the size
// passed tells the kernel which ones the caller knows).
struct RulesetAttr {
  uint64_t handledAccessFs;
  uint64_t handledAccessNet;  // ABI 4
  uint64_t scoped;            // ABI 6
};
struct __attribute__((packed)) PathBeneathAttr {
  uint64_t allowedAccess;
  int32_t parentFd;
};

int result(long r) { return r < 0 ? -errno : static_cast<int>(r); }
}  // namespace

uint64_t VSALandlockAccess::handledBy(int abi) {
  if (abi < 1) return 0;
  uint64_t rights = (kMakeSym << 1) - 1;  // execute .. make symbolic link
  if (abi >= 2) rights |= kRefer;
  if (abi >= 3) rights |= kTruncate;
  if (abi >= 5) rights |= kIoctlDev;
  return rights;
}

int VSALinuxLandlock::abiVersion() {
  return result(syscall(SYS_landlock_create_ruleset, nullptr, 0, kCreateRulesetVersion));
}

int VSALinuxLandlock::createRuleset(uint64_t handledAccess, int abi) {
  RulesetAttr attr{handledAccess, 0, 0};
  // Only the fields the running kernel knows: an older one refuses a larger
  // structure only when the extra fields are not zero, but says nothing useful.
  size_t size = abi >= 6 ? sizeof attr : abi >= 4 ? 2 * sizeof(uint64_t) : sizeof(uint64_t);
  return result(syscall(SYS_landlock_create_ruleset, &attr, size, 0U));
}

int VSALinuxLandlock::allowBeneath(int rulesetFd, int pathFd, uint64_t access) {
  PathBeneathAttr attr{access, pathFd};
  return result(syscall(SYS_landlock_add_rule, rulesetFd, kRulePathBeneath, &attr, 0U));
}

int VSALinuxLandlock::restrictSelf(int rulesetFd) {
  return result(syscall(SYS_landlock_restrict_self, rulesetFd, 0U));
}
