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
#include "platform/VSAUserDatabase.h"

class VSAGlobalConfiguration {
 public:
  // Reads the "mobile" account once, here.
  VSAGlobalConfiguration(VSASystemRoot root, std::shared_ptr<const VSADeviceProperties> device,
                         std::shared_ptr<const VSAUserDatabase> userDatabase);

  const VSASystemRoot& systemRoot() const { return root_; }
  // "/private/var/root/" on the device.
  std::string rootHomeDirectory() const;
  // root home + "Library/Logs/Vessa", created afresh on each call.
  std::string logDirectory() const;

  // uid and gid of the "mobile" account (0 when it is missing, logged).
  uid_t currentMobileUserId() const { return mobileUID_; }
  gid_t currentMobileGroupId() const { return mobileGID_; }

  // Whether this operating-system variant has internal content; the first
  // read asks the platform and overrides any value set before it.
  bool isInternalImage();
  void setIsInternalImage(bool value);

 private:
  VSASystemRoot root_;
  std::shared_ptr<const VSADeviceProperties> device_;
  uid_t mobileUID_ = 0;
  gid_t mobileGID_ = 0;
  std::mutex mutex_;
  bool internalImageComputed_ = false;
  bool internalImage_ = false;
};
