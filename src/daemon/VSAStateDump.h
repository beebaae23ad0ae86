// The daemon's state for people debugging it, taken on SIGUSR1: its queues
// and their depth, open transactions, the container cache's class maps,
// death row and what it left in /tmp, pending protection changes, replace
// journals, test locks, the migration status, work under way and the
// code-signing database's size. The state goes to the log (one line per
// part) and, as JSON, atomically to "state.json" in the run directory,
// where `vessactl status` reads it.
//
// Taking it only reads; it is cheap except for the sizes of death row and
// its leftovers, which are walks of them. Call it once the daemon has
// finished starting (the subsystems it reads are set then); before that,
// startingUp() is the state.
#pragma once

#include <string>
#include <vector>

#include "base/VSAValue.h"
#include "base/VSAWorkQueue.h"

struct VSADaemonContext;

// In the run directory: the last state dump, and the running daemon's pid.
inline constexpr const char* kVSAStateFileName = "state.json";
inline constexpr const char* kVSAPidFileName = "vessad.pid";

class VSAStateDump {
 public:
  // `queues`: the daemon's queues besides the context's own.
  VSAStateDump(VSADaemonContext& context, std::vector<VSAWorkQueue::Ref> queues);

  // `generation` numbers the dumps of one daemon run (vessactl waits for a new one).
  VSAValue collect(uint64_t generation);
  // What a dump says while the daemon is still starting.
  static VSAValue startingUp(uint64_t generation);
  // Writes `state` to the log and to the state file; false (logged) when
  // the file cannot be written.
  bool publish(const VSAValue& state);
  std::string statePath() const;

 private:
  VSAValue queues();
  VSAValue cache();
  VSAValue deathRow();
  VSAValue tmpLeftovers();
  uint64_t entriesIn(const std::string& directory);
  VSAValue testLocks();
  VSAValue migration();
  VSAValue work();
  VSAValue database();
  void log(const VSAValue& state);

  VSADaemonContext& context_;
  std::vector<VSAWorkQueue::Ref> queues_;
};
