// What protection-change operations and their manager are built from: the
// directory layout (where update files live), the caches that turn a
// persisted update back into a container, the lock-state queue that runs
// retries at the next unlock, the daemon's transactions (a pending retry
// keeps the daemon busy), the termination service (an app whose container
// waits for an unlock stays terminated), the lock table and test locks, and
// the code-signing records that hold an identifier's entitlements. Filled
// once by the daemon context, which keeps `codeSigning` alive as long as the
// environment; tests fill their own.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/VSALocks.h"
#include "base/VSATestLocks.h"
#include "base/VSAValue.h"
#include "base/VSAWorkQueue.h"
#include "model/VSACodeSigningQueries.h"
#include "model/VSAContainerCache.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"
#include "platform/VSAApplicationTerminationService.h"
#include "platform/VSATransactions.h"

struct VSADataProtectionEnvironment {
  std::shared_ptr<VSAGlobalConfiguration> configuration;
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache;
  std::shared_ptr<VSAContainerCache> containerCache;
  std::shared_ptr<VSATransactions> transactions;
  // Suspended while the device is locked.
  VSAWorkQueue::Ref lockStateQueue;
  std::shared_ptr<VSAApplicationTerminationService> terminationService;  // may be null
  std::shared_ptr<VSALocks> locks;
  std::shared_ptr<VSATestLocks> testLocks;
  VSACodeSigningQueries* codeSigning = nullptr;  // never null once filled
};
