// Pins vessa-bench and the daemon to one CPU for the life of this object:
// this process (so that its client threads, and a floor process it starts,
// run there) and every thread of the daemon whose pid is given. The masks
// they had come back when it goes. With both on one CPU the scheduler's
// cross-CPU wake-ups (tens of microseconds on a VM) no longer hide the work
// of a request.
#pragma once

#include <sched.h>
#include <sys/types.h>

#include <utility>
#include <vector>

class VSABenchPin {
 public:
  VSABenchPin(pid_t daemon, int cpu);
  ~VSABenchPin();
  VSABenchPin(const VSABenchPin&) = delete;
  VSABenchPin& operator=(const VSABenchPin&) = delete;

  // False when a thread could not be pinned (the run is then not pinned).
  bool pinned() const { return pinned_; }

 private:
  std::vector<std::pair<pid_t, cpu_set_t>> saved_;  // thread (0: this process), its mask
  bool pinned_ = true;
};
