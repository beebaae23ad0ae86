#include "platform/VSATransactions.h"

VSATransactions::Token VSATransactions::open() {
  {
    std::lock_guard lock(mutex_);
    ++open_;
  }
  return Token(static_cast<void*>(this), [this](void*) { close(); });
}

void VSATransactions::close() {
  std::lock_guard lock(mutex_);
  if (--open_ == 0) cv_.notify_all();
}

int VSATransactions::openCount() const {
  std::lock_guard lock(mutex_);
  return open_;
}

bool VSATransactions::waitUntilIdle(std::chrono::milliseconds timeout) {
  std::unique_lock lock(mutex_);
  return cv_.wait_for(lock, timeout, [this] { return open_ == 0; });
}
