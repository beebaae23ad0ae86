// The kernel's Landlock, as the launcher uses it: an interface so that a
// test can stand in a kernel without it (or one that refuses it), and the
// file-system access rights of each ABI version.
//
// The rights are the kernel's bit values (stable across versions); the
// system headers of older distributions lack the newer ones, so they are
// spelled here.
#pragma once

#include <cstdint>

namespace VSALandlockAccess {
inline constexpr uint64_t kExecute = 1ULL << 0;
inline constexpr uint64_t kWriteFile = 1ULL << 1;
inline constexpr uint64_t kReadFile = 1ULL << 2;
inline constexpr uint64_t kReadDir = 1ULL << 3;
inline constexpr uint64_t kRemoveDir = 1ULL << 4;
inline constexpr uint64_t kRemoveFile = 1ULL << 5;
inline constexpr uint64_t kMakeChar = 1ULL << 6;
inline constexpr uint64_t kMakeDir = 1ULL << 7;
inline constexpr uint64_t kMakeReg = 1ULL << 8;
inline constexpr uint64_t kMakeSock = 1ULL << 9;
inline constexpr uint64_t kMakeFifo = 1ULL << 10;
inline constexpr uint64_t kMakeBlock = 1ULL << 11;
inline constexpr uint64_t kMakeSym = 1ULL << 12;
inline constexpr uint64_t kRefer = 1ULL << 13;     // ABI 2: rename and link across directories
inline constexpr uint64_t kTruncate = 1ULL << 14;  // ABI 3
inline constexpr uint64_t kIoctlDev = 1ULL << 15;  // ABI 5: ioctl on device files

// The rights that apply to a file (a rule on a file may only name these).
inline constexpr uint64_t kFileRights = kExecute | kWriteFile | kReadFile | kTruncate | kIoctlDev;

// Every file-system right ABI version `abi` handles (0 for none).
uint64_t handledBy(int abi);
}  // namespace VSALandlockAccess

class VSALandlock {
 public:
  virtual ~VSALandlock() = default;
  // The kernel's Landlock ABI version; a negative errno when it has none
  // (ENOSYS: not built in, EOPNOTSUPP: disabled at boot).
  virtual int abiVersion() = 0;
  // A ruleset handling `handledAccess`: its descriptor or a negative errno.
  virtual int createRuleset(uint64_t handledAccess, int abi) = 0;
  // Allows `access` beneath the file or directory open at `pathFd` (O_PATH).
  // 0 or a negative errno.
  virtual int allowBeneath(int rulesetFd, int pathFd, uint64_t access) = 0;
  // Confines the calling thread (and what it execs) to the ruleset; needs
  // no_new_privs. 0 or a negative errno.
  virtual int restrictSelf(int rulesetFd) = 0;
};

// The running kernel's Landlock, through its system calls.
class VSALinuxLandlock : public VSALandlock {
 public:
  int abiVersion() override;
  int createRuleset(uint64_t handledAccess, int abi) override;
  int allowBeneath(int rulesetFd, int pathFd, uint64_t access) override;
  int restrictSelf(int rulesetFd) override;
};
