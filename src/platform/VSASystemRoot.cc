#include "platform/VSASystemRoot.h"

#include <climits>
#include <cstdio>
#include <cstdlib>

#include "base/VSAPathString.h"

VSASystemRoot::VSASystemRoot(std::string root) {
  if (root.empty()) root = "/";
  char buf[PATH_MAX];
  if (realpath(root.c_str(), buf)) root = buf;
  while (root.size() > 1 && root.back() == '/') root.pop_back();
  root_ = root;
}

std::string VSASystemRoot::resolve(std::string_view devicePath) const {
  if (isHostRoot()) return std::string(devicePath);
  return VSAPathJoin(root_, devicePath);
}

std::string VSASystemRoot::hashSuffix() const {
  uint64_t h = 1469598103934665603ull;  // FNV-1a
  for (unsigned char c : root_) {
    h ^= c;
    h *= 1099511628211ull;
  }
  char buf[17];
  std::snprintf(buf, sizeof buf, "%016llx", static_cast<unsigned long long>(h));
  return buf;
}
