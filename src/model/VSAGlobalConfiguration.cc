#include "model/VSAGlobalConfiguration.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "base/VSAError.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"

namespace {
// mkdir -p with mode 0755; returns 0 or the errno of the failing step.
int makeDirectories(const std::string& path) {
  std::string partial;
  size_t pos = 0;
  while (pos != std::string::npos) {
    pos = path.find('/', pos + 1);
    partial = path.substr(0, pos);
    if (partial.empty()) continue;
    if (mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST) return errno;
  }
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return errno;
  return S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
}
}  // namespace

VSAGlobalConfiguration::VSAGlobalConfiguration(VSASystemRoot root,
                                               std::shared_ptr<const VSADeviceProperties> device,
                                               std::shared_ptr<const VSAUserDatabase> userDatabase)
    : root_(std::move(root)), device_(std::move(device)) {
  auto mobile = userDatabase ? userDatabase->userNamed("mobile") : std::nullopt;
  if (mobile) {
    mobileUID_ = mobile->uid;
    mobileGID_ = mobile->gid;
    VSALog(kVSALogNotice, "VSAGlobalConfiguration", "Current mobile user ID is %u, group ID is %u",
           mobileUID_, mobileGID_);
  } else {
    VSALog(kVSALogError, "VSAGlobalConfiguration", "Failed to get mobile uid. This is bad");
  }
}

std::string VSAGlobalConfiguration::rootHomeDirectory() const {
  return root_.resolve("/private/var/root/");
}

std::string VSAGlobalConfiguration::logDirectory() const {
  std::string dir = VSAPathJoin(rootHomeDirectory(), "Library/Logs/Vessa");
  if (int err = makeDirectories(dir)) {
    VSALog(kVSALogError, __func__, "Failed to create log directory at \"%@\": %@", dir,
           VSA_POSIX_ERROR(err));
  }
  return dir;
}

bool VSAGlobalConfiguration::isInternalImage() {
  std::lock_guard lock(mutex_);
  if (!internalImageComputed_) {
    internalImage_ = device_ && device_->hasInternalContent();
    internalImageComputed_ = true;
  }
  return internalImage_;
}

void VSAGlobalConfiguration::setIsInternalImage(bool value) {
  std::lock_guard lock(mutex_);
  internalImage_ = value;
}
