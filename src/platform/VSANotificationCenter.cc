#include "platform/VSANotificationCenter.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <fstream>
#include <sstream>

#include "base/VSAPathString.h"
#include "base/VSAPlist.h"

VSANotificationCenter::VSANotificationCenter(VSASystemRoot root) : root_(std::move(root)) {}

std::string VSANotificationCenter::logPath() const {
  return root_.resolve("/run/vessad/notifications.log");
}

uint32_t VSANotificationCenter::post(const std::string& name) {
  int fd = ::open(logPath().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (fd < 0 && errno == ENOENT) {
    // The run directory is made on demand (a root may not have one yet).
    VSAMakeDirectories(VSADirectoryName(logPath()));
    fd = ::open(logPath().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  }
  if (fd < 0) return static_cast<uint32_t>(errno);
  std::string line = std::to_string(static_cast<long long>(time(nullptr))) + " " + name + "\n";
  ssize_t n = ::write(fd, line.data(), line.size());
  int err = n == static_cast<ssize_t>(line.size()) ? 0 : (n < 0 ? errno : EIO);
  ::close(fd);
  return static_cast<uint32_t>(err);
}

std::vector<std::string> VSANotificationCenter::postedNames() const {
  std::vector<std::string> out;
  std::ifstream in(logPath());
  std::string line;
  while (std::getline(in, line)) {
    size_t space = line.find(' ');
    if (space != std::string::npos) out.push_back(line.substr(space + 1));
  }
  return out;
}
