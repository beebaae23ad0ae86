// What a launched app may reach on disk: its containers, as the upcall (and
// the bundle look-up) named them, turned into Landlock rules.
//
//   read-write    beneath its data container, group containers, system
//                 container, system group containers and --allow-write paths
//                 (everything but executing: nothing is run from app data)
//   read-execute  beneath the system's own directories (the default list
//                 below) and the app's bundle container
//   read          beneath --allow-read paths
//   device        the device files programs expect and the terminal
// Everything else is out of reach: other containers, other users' homes,
// the daemon's state, /tmp.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/VSAValue.h"
#include "platform/VSALandlock.h"

struct VSALaunchContainers {
  std::string dataContainer, temporaryDirectory;
  std::optional<std::string> bundleContainer, systemContainer;
  std::vector<std::pair<std::string, std::string>> groups, systemGroups;  // identifier, path
};

struct VSALaunchRule {
  enum class Access { ReadWrite, ReadExecute, Read, Device };
  std::string path;
  Access access;
  bool optional;  // a default that this machine may not have: skipped when missing
};

class VSALaunchRules {
 public:
  // The system directories every app may read and run programs from.
  static const std::vector<std::string>& systemDirectories();
  // The device files every app may read and write (the terminals of the
  // standard descriptors are added when they are ones).
  static const std::vector<std::string>& deviceFiles();

  VSALaunchRules(const VSALaunchContainers& containers, const std::vector<std::string>& allowRead,
                 const std::vector<std::string>& allowWrite);

  const std::vector<VSALaunchRule>& rules() const { return rules_; }
  // The rights an access kind grants under ABI `abi` (file rights only for a
  // rule on a file).
  static uint64_t rights(VSALaunchRule::Access access, int abi, bool directory);
  static const char* name(VSALaunchRule::Access access);
  VSAValue description() const;

  // One ruleset with every rule, under ABI `abi`: its descriptor, or -1
  // after saying in `why` which path or call failed.
  int build(VSALandlock& landlock, int abi, bool verbose, std::string* why) const;

 private:
  void add(const std::string& path, VSALaunchRule::Access access, bool optional);
  std::vector<VSALaunchRule> rules_;
};
