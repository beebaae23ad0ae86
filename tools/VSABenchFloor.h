// A floor process for vessa-bench: vessa-floor (the least work that could
// answer, a process of its own) started on a socket of its own in a scratch
// directory, and stopped with this object. A process started while this one
// is pinned to a CPU runs on that CPU too.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

class VSABenchFloor {
 public:
  // `arguments`: "stream" or "seqpacket", then what follows the socket on
  // vessa-floor's command line; `program` the vessa-floor binary.
  VSABenchFloor(const std::string& program, const std::vector<std::string>& arguments);
  ~VSABenchFloor();
  VSABenchFloor(const VSABenchFloor&) = delete;
  VSABenchFloor& operator=(const VSABenchFloor&) = delete;

  // False when the floor did not start (the reason is on standard error).
  bool running() const { return pid_ > 0; }
  const std::string& socket() const { return socket_; }

 private:
  std::string directory_;
  std::string socket_;
  pid_t pid_ = -1;
  int stdin_ = -1;  // closing it ends the floor
};
