// The system root: the directory that stands for "/" of the device.
//
// Every absolute path the daemon uses ("/private/var/containers", "/tmp",
// "/etc/vessad", ...) is resolved below it, so a whole device fits in a
// temporary directory and several daemons can run side by side. The root
// "/" is the host itself. Immutable after construction; thread-safe.
#pragma once

#include <string>
#include <string_view>

class VSASystemRoot {
 public:
  // `root` is made absolute and canonical when it exists.
  explicit VSASystemRoot(std::string root = "/");

  const std::string& path() const { return root_; }
  bool isHostRoot() const { return root_ == "/"; }
  // The host path of a device path ("/etc/x" -> "<root>/etc/x").
  std::string resolve(std::string_view devicePath) const;

  std::string runDirectory() const { return resolve("/run/vessad"); }
  std::string configDirectory() const { return resolve("/etc/vessad"); }
  std::string socketPath() const { return resolve("/run/vessad/com.tamsk.vessad"); }
  std::string upcallSocketPath() const { return resolve("/run/vessad/com.tamsk.vessad.upcall"); }
  // A short stable hash of the root path, for host-global names.
  std::string hashSuffix() const;

 private:
  std::string root_;
};
