// The daemon's global directory layout (the one module that owns paths).
//
// Every directory is a device path resolved below the system root and is
// created (with missing parents, mode 0755) each time it is asked for, so a
// directory removed behind the daemon's back comes back on the next request;
// creation failures are logged and the path is still returned.
// Thread-safe: immutable apart from the internal-image answer, which is
// computed once on first read.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/VSADeviceProperties.h"
#include "platform/VSASystemRoot.h"

class VSAGlobalConfiguration {
 public:
  VSAGlobalConfiguration(VSASystemRoot root, std::shared_ptr<const VSADeviceProperties> device);

  const VSASystemRoot& systemRoot() const { return root_; }
  // "/private/var/root/" on the device.
  std::string rootHomeDirectory() const;
  // root home + "Library/Logs/Vessa", created afresh on each call.
  std::string logDirectory() const;

  // Whether this operating-system variant has internal content; the first
  // read asks the platform and overrides any value set before it.
  bool isInternalImage();
  void setIsInternalImage(bool value);

 private:
  VSASystemRoot root_;
  std::shared_ptr<const VSADeviceProperties> device_;
  std::mutex mutex_;
  bool internalImageComputed_ = false;
  bool internalImage_ = false;
};
