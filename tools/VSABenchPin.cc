#include "VSABenchPin.h"

#include <dirent.h>

#include <cstdlib>
#include <string>

namespace {
// The threads of `pid`, from /proc.
std::vector<pid_t> threadsOf(pid_t pid) {
  std::vector<pid_t> threads;
  std::string dir = "/proc/" + std::to_string(pid) + "/task";
  if (DIR* d = opendir(dir.c_str())) {
    while (dirent* e = readdir(d))
      if (e->d_name[0] != '.') threads.push_back(static_cast<pid_t>(std::atoi(e->d_name)));
    closedir(d);
  }
  return threads;
}
}  // namespace

VSABenchPin::VSABenchPin(pid_t daemon, int cpu) {
  cpu_set_t one;
  CPU_ZERO(&one);
  CPU_SET(cpu, &one);
  std::vector<pid_t> all = threadsOf(daemon);
  all.push_back(0);
  if (daemon <= 0 || all.size() == 1) pinned_ = false;
  for (pid_t tid : all) {
    cpu_set_t before;
    if (sched_getaffinity(tid, sizeof before, &before) != 0) {
      pinned_ = false;
      continue;
    }
    saved_.emplace_back(tid, before);
    if (sched_setaffinity(tid, sizeof one, &one) != 0) pinned_ = false;
  }
}

VSABenchPin::~VSABenchPin() {
  for (auto& [tid, mask] : saved_) sched_setaffinity(tid, sizeof mask, &mask);
}
