#include "platform/VSALockStateService.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <fstream>

#include "base/VSAPlist.h"

VSALockStateService::VSALockStateService(VSASystemRoot root) : root_(std::move(root)) {}
VSALockStateService::~VSALockStateService() = default;

std::string VSALockStateService::stateFilePath() const {
  return root_.resolve("/run/vessad/lockstate");
}

int VSALockStateService::currentLockState() const {
  std::ifstream in(stateFilePath());
  std::string text;
  if (!(in >> text)) return 0;
  char* end = nullptr;
  long v = std::strtol(text.c_str(), &end, 10);
  if (end == text.c_str()) return -1;  // unreadable: a state nobody acts on
  return static_cast<int>(v);
}

bool VSALockStateService::setLockState(int state) {
  std::string s = std::to_string(state) + "\n";
  return VSAWriteFileAtomically(stateFilePath(), std::vector<uint8_t>(s.begin(), s.end()), 0644,
                                nullptr);
}

int VSALockStateService::registerForLockStatus(VSAWorkQueue::Ref queue,
                                               std::function<void()> handler) {
  std::string dir = root_.runDirectory();
  VSAMakeDirectories(dir);
  auto watcher = std::make_unique<VSAInotifyWatcher>(
      dir, std::set<std::string>{"lockstate"}, std::move(queue),
      [handler = std::move(handler)](const std::string&) { handler(); });
  VSAErrorRef error;
  if (!watcher->start(&error)) return error ? static_cast<int>(error->code()) : EINVAL;
  watcher_ = std::move(watcher);
  return 0;
}
