#include "operations/VSADeathRow.h"

#include <cerrno>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAProgressLog.h"
#include "base/VSAUUID.h"

namespace {
// Tries to move one item into a fresh death-row directory that a concurrent
// emptying may remove first.
constexpr int kMoveAttempts = 5;
// Removals of one death-row entry before it is moved aside to /tmp.
constexpr int kRemoveAttempts = 3;

bool isMissing(const VSAErrorRef& e) {
  return e && e->domain() == kVSAPOSIXErrorDomain && e->code() == ENOENT;
}
}  // namespace

VSADeathRow::VSADeathRow(std::shared_ptr<VSAGlobalConfiguration> configuration,
                         std::shared_ptr<VSATransactions> transactions,
                         VSAWorkQueue::Ref backgroundQueue)
    : configuration_(std::move(configuration)),
      transactions_(std::move(transactions)),
      backgroundQueue_(std::move(backgroundQueue)) {}

bool VSADeathRow::_moveItemAtURLToDeathRow(const std::string& url, VSADeathRowMoveOptions options,
                                           VSAErrorRef* error) {
  const bool startDeletionThread = options.startDeletionThread, durable = options.durable;
  const char* fn = "_moveItemAtURLToDeathRow";
  VSAFileManager& fm = configuration_->fileManager();
  std::string deathrow = configuration_->deathrowDirectory();
  std::string destination;
  for (int attempt = 1;; ++attempt) {
    VSAErrorRef underlying;
    auto unique = fm.createTemporaryDirectoryInDirectoryURL(deathrow, &underlying);
    if (!unique) {
      auto e = VSA_ERROR_UNDERLYING(VSAResult::kDeathRowMoveFailed, underlying,
                                    "Failed to create unique directory at: %@", deathrow);
      VSALog(kVSALogError, fn, "%@", e->message());
      VSASetError(error, e);
      return false;
    }
    destination = VSAPathJoin(*unique, VSALastPathComponent(url));
    if (fm.moveItemAtURL(url, destination, &underlying, durable)) break;
    fm.fileSystem().rmdir(*unique);
    // ENOENT: the item is gone (nothing to do), or an emptying of death row
    // took the fresh directory before the item reached it (take another).
    if (isMissing(underlying) && fm.itemDoesNotExistAtURL(url)) return true;
    if (isMissing(underlying) && attempt < kMoveAttempts) continue;
    auto e = VSA_ERROR_UNDERLYING(VSAResult::kDeathRowMoveFailed, underlying,
                                  "Failed to move item at: %@ to: %@", url, destination);
    VSALog(kVSALogError, fn, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  // Its former owner must not race the removal: the item becomes root's
  // (the directory above it already is, with mode 0700).
  // (An emptying of death row may already have removed it.)
  VSAErrorRef restrictError;
  if (!fm.restrictItemToRootAtURL(destination, &restrictError) &&
      !fm.itemDoesNotExistAtURL(destination))
    VSALog(kVSALogError, fn, "%@", restrictError ? restrictError->message() : std::string());
  if (startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
  return true;
}

bool VSADeathRow::_moveEntriesToDeathRowWithoutSync(const std::vector<std::string>& urls) {
  const char* fn = "_moveEntriesToDeathRowWithoutSync";
  if (urls.empty()) return true;
  VSAFileManager& fm = configuration_->fileManager();
  VSAErrorRef error;
  auto unique =
      fm.createTemporaryDirectoryInDirectoryURL(configuration_->deathrowDirectory(), &error);
  if (!unique) {
    VSALog(kVSALogError, fn, "Failed to create unique directory on death row: %@", error);
    return false;
  }
  bool all = true;
  for (const auto& url : urls) {
    std::string destination = VSAPathJoin(*unique, VSALastPathComponent(url));
    VSAErrorRef moveError;
    if (!fm.moveItemAtURL(url, destination, &moveError, false)) {
      if (isMissing(moveError) && fm.itemDoesNotExistAtURL(url)) continue;
      // The shared directory went with an emptying of death row: this item
      // (and the ones after it) take fresh directories of their own.
      if (isMissing(moveError)) {
        VSAErrorRef single;
        if (!_moveItemAtURLToDeathRow(url, {.durable = false}, &single)) all = false;
        continue;
      }
      VSALog(kVSALogError, fn, "Failed to move item at: %@ to: %@: %@", url, destination,
             moveError);
      all = false;
      continue;
    }
    VSAErrorRef restrictError;
    if (!fm.restrictItemToRootAtURL(destination, &restrictError) &&
        !fm.itemDoesNotExistAtURL(destination))
      VSALog(kVSALogError, fn, "%@", restrictError);
  }
  return all;
}

void VSADeathRow::deleteContainersOnDeathRowWithCompletion(Completion completion) {
  auto token = transactions_ ? transactions_->open() : nullptr;
  // The background queue is process-wide and may run this after the daemon
  // context that made it is gone (tests build many), so the work owns its object.
  _sharedBackgroundQueue()->async(
      [self = shared_from_this(), token, completion = std::move(completion)] {
        VSAResultCode code = self->emptyDeathRow();
        if (completion) completion(code);
      });
}

VSAResultCode VSADeathRow::emptyDeathRow() {
  const char* fn = "deleteContainersOnDeathRowWithCompletion";
  VSAFileManager& fm = configuration_->fileManager();
  std::string deathrow = configuration_->deathrowDirectory();
  VSAErrorRef error;
  auto items = fm.urlsForItemsInDirectoryAtURL(deathrow, &error);
  if (!items) {
    if (isMissing(error)) return VSAResult::kSuccess;
    VSALog(kVSALogError, fn, "Failed to get items for deletion: %@ : %@", deathrow, error);
    return VSAResult::kDeleteFailed;
  }
  VSAResultCode code = VSAResult::kSuccess;
  VSAProgressLog progress(VSALogCategory::Unspecified, fn, "Emptying death row", items->size(),
                          "entries");
  auto freed = [&progress](uint64_t bytes) { progress.addBytes(bytes); };
  for (const auto& item : *items) {
    if (!_removeItemOrMoveToTempAtURL(item.path, &error, freed)) {
      VSALog(kVSALogError, fn, "Failed to destroy item at: %@", item.path);
      code = VSAResult::kDeleteFailed;
    }
    progress.advance();
  }
  return code;
}

bool VSADeathRow::_removeItemOrMoveToTempAtURL(const std::string& url, VSAErrorRef* error,
                                               const VSAFileManager::RemovalObserver& observer) {
  const char* fn = "_removeItemOrMoveToTempAtURL";
  VSAFileManager& fm = configuration_->fileManager();
  VSAErrorRef removeError;
  // A move into death row makes its fresh directory first and then renames
  // the item into it: an entry listed while still empty can gain its item
  // while it is removed, and its last rmdir then fails. The item is whole
  // by the next attempt, which removes it.
  for (int attempt = 0; attempt < kRemoveAttempts; ++attempt) {
    removeError = nullptr;
    if (fm.removeItemAtURL(url, &removeError, observer)) return true;
  }
  VSALog(kVSALogDebug, fn, "Couldn't remove, so moving item to /tmp: %@ : %@", url, removeError);
  std::string tmp = temporaryDirectory(*configuration_);
  if (fm.itemDoesNotExistAtURL(tmp))
    fm.createDirectoryAtURL(tmp, true, 01777, 0, kVSANoProtectionClass, nullptr);
  std::string destination = VSAPathJoin(tmp, VSALastPathComponent(url));
  if (fm.moveItemAtURL(url, destination, error)) return true;
  VSALog(kVSALogError, fn, "Failed to move dir: %@ to: %@", url, destination);
  return false;
}

std::string VSADeathRow::temporaryDirectory(const VSAGlobalConfiguration& configuration) {
  return configuration.systemRoot().resolve("/tmp");
}

bool VSADeathRow::isDeathRowEntryName(const std::string& name) {
  if (name.size() == 11 && name.rfind("temp.", 0) == 0) return true;
  return VSAUUID::parse(name).has_value();
}

std::vector<VSADeathRow::Leftover> VSADeathRow::leftoversInTemp(
    const VSAGlobalConfiguration& configuration) {
  VSAFileManager& fm = configuration.fileManager();
  std::string tmp = temporaryDirectory(configuration);
  std::vector<VSADirectoryEntry> entries;
  std::vector<Leftover> found;
  if (fm.fileSystem().readDirectory(tmp, &entries) != 0) return found;
  for (const auto& e : entries) {
    if (!isDeathRowEntryName(e.name)) continue;
    std::string path = VSAPathJoin(tmp, e.name);
    found.push_back({path, fm.diskUsageForURL(path)});
  }
  return found;
}
