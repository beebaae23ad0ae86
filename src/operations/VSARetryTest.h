// The crash-retry test (internal builds): proves that an operation persisted
// before a crash is picked up again by the next start, however many times
// the daemon dies in the middle of it.
//
// retryTestWithNumCrashes(N) writes the journal "RetryTest.plist" in the
// daemon's library directory ({"NumRetryCrashes": N, "CrashesLeft": N},
// written atomically and durably), then runs an attempt. An attempt reads
// the journal back; while crashes are left it first records one fewer
// (durably) and then ends the process on purpose; with none left it removes
// the journal and logs that the test finished. Every start resumes a
// journal it finds (resumeRetryTestIfPending, from keeper setup), so a
// request for N crashes ends after N crashes and N restarts. N is at most
// kVSAMaxRetryCrashes (38 otherwise), so a mistake cannot keep a device in
// a crash loop for long. A journal that cannot be read or is not valid is
// logged and removed (35), never acted on.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "base/VSAError.h"
#include "operations/VSAOperationServices.h"

inline constexpr uint64_t kVSAMaxRetryCrashes = 10;
inline constexpr const char* kVSARetryTestFileName = "RetryTest.plist";

class VSARetryTest {
 public:
  // `crash` ends the process with its message (tests pass one that throws).
  explicit VSARetryTest(const VSAOperationServices& services,
                        std::function<void(const std::string&)> crash = {});

  [[nodiscard]] bool retryTestWithNumCrashes(uint64_t numCrashes, VSAResultCode* withError);
  // At start: continues a test a crash interrupted; true when none was pending
  // or it finished now.
  [[nodiscard]] bool resumeRetryTestIfPending(VSAResultCode* withError);

  struct Journal {
    uint64_t numRetryCrashes = 0;
    uint64_t crashesLeft = 0;
  };
  // The journal on disk; nothing when there is none (or it is invalid: see `withError`).
  [[nodiscard]] std::optional<Journal> readJournal(VSAResultCode* withError);

 private:
  std::string journalPath();
  [[nodiscard]] bool writeJournal(const Journal& journal, VSAResultCode* withError);
  [[nodiscard]] bool attempt(VSAResultCode* withError);

  const VSAOperationServices& services_;
  std::function<void(const std::string&)> crash_;
};
