// Bringing the disk into order when the daemon starts. The two setups run
// synchronously on the listener queue before the first request; the two
// cleanups queue their slow part on the background queue and call their
// completion when done (possibly later, on another queue), holding a
// transaction that keeps the daemon alive until then. The first-boot pair
// runs only at the first start after a device boot.
#pragma once

#include <functional>

#include "operations/VSAOperationServices.h"

class VSABootKeeper {
 public:
  explicit VSABootKeeper(const VSAOperationServices& services) : services_(services) {}

  void rebootKeeperSetup();
  void keeperSetup();
  void rebootKeeperCleanupWithCompletion(std::function<void()> completion);
  void keeperCleanupWithCompletion(std::function<void()> completion);

 private:
  const VSAOperationServices& services_;
};
