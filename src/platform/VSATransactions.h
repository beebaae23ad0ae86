// Transactions: the keep-alive count of work the daemon must finish before
// it may exit.
//
// open() hands out a token; the transaction ends when the last copy of the
// token is released. An orderly shutdown calls waitUntilIdle(), which returns
// once no transaction is open. Thread-safe; a token may outlive the object
// that issued it (its count lives in state the token shares).
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>

class VSATransactions {
 public:
  using Token = std::shared_ptr<void>;

  Token open();
  int openCount() const;
  // How many were ever opened: it moves whenever anything was done.
  uint64_t openedCount() const;
  // False when `timeout` passed with transactions still open.
  bool waitUntilIdle(std::chrono::milliseconds timeout);

 private:
  struct State {
    std::mutex mutex;
    std::condition_variable cv;
    int open = 0;
    uint64_t opened = 0;
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};
