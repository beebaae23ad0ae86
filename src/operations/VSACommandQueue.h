// Deferred commands of one request (or one boot-time run).
//
// A handler that decides on work that must not run inside it (typically a
// stage-for-delete that needs the all-identifiers write lock) appends a
// command; after the handler, the dispatcher drains the queue through
// VSAClientConnection::completeWithError. Commands run strictly in insertion
// order, one at a time, synchronously on the queue's own serial work queue
// "com.tamsk.vessad.VSACommandQueue"; a running command may insert further
// commands, which run in the same drain. Insertion and removal synchronise on
// the command list, so any thread may insert.
#pragma once

#include <deque>
#include <memory>
#include <mutex>
#include <vector>

#include "base/VSACommands.h"
#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"

class VSACommandQueue;

class VSACommand {
 public:
  virtual ~VSACommand() = default;
  // The number of the request command whose work this is, used in logs.
  virtual VSACommandNumber command() const = 0;
  // Runs the command; on failure stores a code in `error` and returns false.
  [[nodiscard]] virtual bool fromQueue(VSACommandQueue& queue, VSAResultCode* executeWithError) = 0;
};

class VSACommandQueue {
 public:
  VSACommandQueue();

  void insertCommand(std::shared_ptr<VSACommand> command);
  // Runs the oldest command. Without one the code is 77 and the answer NO.
  [[nodiscard]] bool executeNextCommandWithError(VSAResultCode* error);
  // Runs commands until none is left (YES, cell untouched) or one fails (NO,
  // its code in the cell; later commands are not run).
  [[nodiscard]] bool executeAllUntilExhaustedOrError(VSAResultCode* error);
  size_t count() const;
  // A snapshot of the pending commands, oldest first.
  std::vector<std::shared_ptr<VSACommand>> pendingCommands() const;

 private:
  VSAWorkQueue::Ref queue_;
  mutable std::mutex commandsMutex_;
  std::deque<std::shared_ptr<VSACommand>> commands_;
};
