#include "operations/VSACommandQueue.h"

#include "base/VSALog.h"

VSACommandQueue::VSACommandQueue()
    : queue_(VSAWorkQueue::create("com.tamsk.vessad.VSACommandQueue")) {}

void VSACommandQueue::insertCommand(std::shared_ptr<VSACommand> command) {
  const void* p = command.get();
  VSACommandNumber type = command->command();
  {
    std::lock_guard lock(commandsMutex_);
    commands_.push_back(std::move(command));
  }
  VSALog(kVSALogInfo, __func__, "Added command <%p; %llu> to queue", p, type);
}

size_t VSACommandQueue::count() const {
  std::lock_guard lock(commandsMutex_);
  return commands_.size();
}

std::vector<std::shared_ptr<VSACommand>> VSACommandQueue::pendingCommands() const {
  std::lock_guard lock(commandsMutex_);
  return {commands_.begin(), commands_.end()};
}

bool VSACommandQueue::executeNextCommandWithError(VSAResultCode* error) {
  std::shared_ptr<VSACommand> command;
  {
    std::lock_guard lock(commandsMutex_);
    if (!commands_.empty()) {
      command = std::move(commands_.front());
      commands_.pop_front();
    }
  }
  if (!command) {
    VSASetCode(error, VSAResult::kQueueExhausted);
    return false;
  }
  bool success = false;
  VSAResultCode code = VSAResult::kSuccess;
  queue_->sync([&] {
    const void* p = command.get();
    VSALog(kVSALogInfo, "executeNextCommandWithError", "Executing command <%p; %llu>...", p,
           command->command());
    success = command->fromQueue(*this, &code);
    VSALog(kVSALogInfo, "executeNextCommandWithError",
           "Completed command <%p; %llu>: success = %d, error = %llu", p, command->command(),
           success, code);
  });
  if (!success) VSASetCode(error, code);
  return success;
}

bool VSACommandQueue::executeAllUntilExhaustedOrError(VSAResultCode* error) {
  VSAResultCode code = VSAResult::kSuccess;
  while (executeNextCommandWithError(&code)) {
  }
  if (code == VSAResult::kQueueExhausted) return true;
  VSASetCode(error, code);
  return false;
}
