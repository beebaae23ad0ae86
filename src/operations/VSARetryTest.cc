#include "operations/VSARetryTest.h"

#include <cerrno>

#include "base/VSACrash.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"

namespace {
constexpr const char* kOrigin = "retryTestWithNumCrashes";
constexpr size_t kJournalMaxSize = 4096;
// An invalid persisted journal answers like an invalid replace journal.
constexpr VSAResultCode kInvalidJournal = VSAResult::kInvalidReplaceFile;

bool fail(VSAResultCode code, VSAResultCode* cell, const std::string& message) {
  VSALog(kVSALogError, kOrigin, "%@", message);
  VSASetCode(cell, code);
  return false;
}

std::optional<uint64_t> count(const VSAValue& plist, const char* key) {
  const VSAValue* v = plist.get(key);
  return v && v->isInteger() ? v->uint64Value() : std::nullopt;
}
}  // namespace

VSARetryTest::VSARetryTest(const VSAOperationServices& services,
                           std::function<void(const std::string&)> crash)
    : services_(services), crash_(std::move(crash)) {
  if (!crash_) crash_ = [](const std::string& message) { VSACrash(message); };
}

std::string VSARetryTest::journalPath() {
  return VSAPathJoin(services_.configuration->libraryDirectory(), kVSARetryTestFileName);
}

std::optional<VSARetryTest::Journal> VSARetryTest::readJournal(VSAResultCode* withError) {
  std::string path = journalPath();
  std::vector<uint8_t> bytes;
  int rc = services_.fileManager->fileSystem().readFile(path, &bytes, kJournalMaxSize);
  if (rc == ENOENT) return std::nullopt;
  auto plist = rc == 0 ? VSAPlist::parse(bytes, nullptr) : std::nullopt;
  auto total = plist ? count(*plist, "NumRetryCrashes") : std::nullopt;
  auto left = plist ? count(*plist, "CrashesLeft") : std::nullopt;
  if (!total || !left || *left > *total || *total > kVSAMaxRetryCrashes) {
    fail(kInvalidJournal, withError,
         VSAFormat("Invalid retry test journal at %@ (read: %d); removing it", path, rc));
    VSAErrorRef error;
    services_.fileManager->removeFileAtURL(path, &error);
    return std::nullopt;
  }
  return Journal{*total, *left};
}

bool VSARetryTest::writeJournal(const Journal& journal, VSAResultCode* withError) {
  VSAValue plist = VSAValue::Dictionary{{"NumRetryCrashes", VSAValue(journal.numRetryCrashes)},
                                        {"CrashesLeft", VSAValue(journal.crashesLeft)}};
  auto bytes = VSAPlist::serialize(plist, VSAPlist::Format::Binary, nullptr);
  VSAErrorRef error;
  if (!bytes || !services_.fileManager->writeFileAtomicallyAtURL(journalPath(), *bytes, 0600,
                                                                 std::nullopt, &error))
    return fail(VSAResult::kWriteFailed, withError,
                VSAFormat("Failed to write retry test journal: %@", error));
  return true;
}

bool VSARetryTest::retryTestWithNumCrashes(uint64_t numCrashes, VSAResultCode* withError) {
  if (numCrashes > kVSAMaxRetryCrashes)
    return fail(VSAResult::kOutOfRange, withError,
                VSAFormat("Invalid number of retry crashes: %llu (at most %llu)", numCrashes,
                          kVSAMaxRetryCrashes));
  VSALog(kVSALogNotice, kOrigin, "Starting retry test with %llu crashes", numCrashes);
  if (!writeJournal({numCrashes, numCrashes}, withError)) return false;
  return attempt(withError);
}

bool VSARetryTest::resumeRetryTestIfPending(VSAResultCode* withError) {
  VSAResultCode code = VSAResult::kSuccess;
  auto journal = readJournal(&code);
  if (code != VSAResult::kSuccess) return fail(code, withError, "Dropped the retry test");
  if (!journal) return true;
  VSALog(kVSALogNotice, kOrigin, "Resuming retry test: %llu of %llu crashes left",
         journal->crashesLeft, journal->numRetryCrashes);
  return attempt(withError);
}

bool VSARetryTest::attempt(VSAResultCode* withError) {
  VSAResultCode code = VSAResult::kSuccess;
  auto journal = readJournal(&code);
  if (!journal)
    return fail(code == VSAResult::kSuccess ? kInvalidJournal : code, withError,
                "Retry test journal vanished");
  if (journal->crashesLeft > 0) {
    --journal->crashesLeft;
    // Recorded before the crash: the next start must see this crash counted.
    if (!writeJournal(*journal, withError)) return false;
    crash_(VSAFormat("Retry test: crashing on purpose (%llu of %llu crashes left)",
                     journal->crashesLeft, journal->numRetryCrashes));
    return false;
  }
  VSAErrorRef error;
  if (!services_.fileManager->removeFileAtURL(journalPath(), &error))
    return fail(VSAResult::kRemoveFailed, withError,
                VSAFormat("Failed to remove retry test journal: %@", error));
  VSALog(kVSALogNotice, kOrigin, "Retry test finished after %llu crashes",
         journal->numRetryCrashes);
  return true;
}
