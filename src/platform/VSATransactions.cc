#include "platform/VSATransactions.h"

VSATransactions::Token VSATransactions::open() {
  {
    std::lock_guard lock(state_->mutex);
    ++state_->open;
    ++state_->opened;
  }
  return Token(static_cast<void*>(state_.get()), [state = state_](void*) {
    std::lock_guard lock(state->mutex);
    if (--state->open == 0) state->cv.notify_all();
  });
}

int VSATransactions::openCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->open;
}

uint64_t VSATransactions::openedCount() const {
  std::lock_guard lock(state_->mutex);
  return state_->opened;
}

bool VSATransactions::waitUntilIdle(std::chrono::milliseconds timeout) {
  std::unique_lock lock(state_->mutex);
  return state_->cv.wait_for(lock, timeout, [this] { return state_->open == 0; });
}
