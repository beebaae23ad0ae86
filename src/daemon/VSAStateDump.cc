#include "daemon/VSAStateDump.h"

#include <sys/stat.h>
#include <unistd.h>

#include <chrono>

#include "base/VSAJSON.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "base/VSAProgressLog.h"
#include "base/VSATestLocks.h"
#include "codesigning/VSASQLiteDB.h"
#include "daemon/VSADaemonContext.h"
#include "migration/VSAMigrationStatus.h"
#include "operations/VSADeathRow.h"

namespace {
constexpr size_t kMigrationStatusMaxSize = 1 << 20;

uint64_t secondsSince1970() {
  return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::seconds>(
                                   std::chrono::system_clock::now().time_since_epoch())
                                   .count());
}

VSAValue header(uint64_t generation, bool serving) {
  return VSAValue::Dictionary{{"pid", VSAValue(static_cast<int64_t>(::getpid()))},
                              {"generation", VSAValue(generation)},
                              {"writtenAt", VSAValue(secondsSince1970())},
                              {"serving", VSAValue(serving)}};
}
}  // namespace

VSAStateDump::VSAStateDump(VSADaemonContext& context, std::vector<VSAWorkQueue::Ref> queues)
    : context_(context), queues_(std::move(queues)) {}

VSAValue VSAStateDump::startingUp(uint64_t generation) { return header(generation, false); }

VSAValue VSAStateDump::collect(uint64_t generation) {
  VSAValue state = header(generation, true);
  auto& config = *context_.globalConfiguration;
  state.set("queues", queues());
  state.set("openTransactions", VSAValue(static_cast<int64_t>(context_.transactions->openCount())));
  state.set("containerCache", cache());
  state.set("deathRow", deathRow());
  state.set("tmpLeftovers", tmpLeftovers());
  state.set("pendingProtectionUpdates", VSAValue(entriesIn(config.pendingUpdatesDirectory())));
  state.set("replaceFilesInProgress", VSAValue(entriesIn(config.replaceDirectory())));
  state.set("testLocks", testLocks());
  state.set("migration", migration());
  state.set("work", work());
  state.set("codeSigningDatabase", database());
  return state;
}

VSAValue VSAStateDump::queues() {
  std::vector<VSAWorkQueue::Ref> all = {context_.listenerQueue, context_.deathrowQueue,
                                        context_.lockStateQueue};
  all.insert(all.end(), queues_.begin(), queues_.end());
  VSAValue list = VSAValue::array();
  for (const auto& q : all) {
    if (!q) continue;
    list.append(VSAValue::Dictionary{{"label", VSAValue(q->label())},
                                     {"depth", VSAValue(static_cast<uint64_t>(q->depth()))},
                                     {"suspended", VSAValue(q->suspendCount() > 0)}});
  }
  return list;
}

VSAValue VSAStateDump::cache() {
  VSAValue list = VSAValue::array();
  for (const auto& size : context_.containerCache->classMapSizes())
    list.append(
        VSAValue::Dictionary{{"key", VSAValue(size.key)},
                             {"transient", VSAValue(size.transient)},
                             {"containers", VSAValue(static_cast<uint64_t>(size.containers))}});
  return list;
}

VSAValue VSAStateDump::deathRow() {
  std::string directory = context_.globalConfiguration->deathrowDirectory();
  std::vector<VSADirectoryEntry> entries;
  context_.fileSystem->readDirectory(directory, &entries);
  uint64_t bytes = 0;
  for (const auto& e : entries)
    bytes += context_.fileManager->diskUsageForURL(VSAPathJoin(directory, e.name));
  return VSAValue::Dictionary{{"entries", VSAValue(static_cast<uint64_t>(entries.size()))},
                              {"bytes", VSAValue(bytes)}};
}

// What death row moved to /tmp because it could not remove it.
VSAValue VSAStateDump::tmpLeftovers() {
  uint64_t bytes = 0;
  auto leftovers = VSADeathRow::leftoversInTemp(*context_.globalConfiguration);
  for (const auto& leftover : leftovers) bytes += leftover.bytes;
  return VSAValue::Dictionary{{"entries", VSAValue(static_cast<uint64_t>(leftovers.size()))},
                              {"bytes", VSAValue(bytes)}};
}

uint64_t VSAStateDump::entriesIn(const std::string& directory) {
  std::vector<VSADirectoryEntry> entries;
  if (context_.fileSystem->readDirectory(directory, &entries) != 0) return 0;
  return entries.size();
}

VSAValue VSAStateDump::testLocks() {
  auto& locks = *context_.testLocks;
  VSAValue held = VSAValue::array();
  for (uint64_t lock = 0; lock < kVSATestLockCount; ++lock)
    if (int64_t count = locks.countForLock(lock))
      held.append(VSAValue::Dictionary{{"lock", VSAValue(lock)}, {"count", VSAValue(count)}});
  return VSAValue::Dictionary{{"enabled", VSAValue(locks.enabled())}, {"held", held}};
}

// What the system migration status file records (completed migrations and
// the build they last ran on), read as it stands.
VSAValue VSAStateDump::migration() {
  std::string path = VSAPathJoin(context_.globalConfiguration->libraryDirectory(),
                                 kVSASystemMigrationStatusFileName);
  std::vector<uint8_t> bytes;
  int rc = context_.fileSystem->readFile(path, &bytes, kMigrationStatusMaxSize);
  if (rc == ENOENT) return VSAValue::Dictionary{{"statusFile", VSAValue("absent")}};
  VSAErrorRef error;
  auto status = rc == 0 ? VSAPlist::parse(bytes, &error) : std::nullopt;
  if (!status || !status->isDictionary())
    return VSAValue::Dictionary{{"statusFile", VSAValue("unreadable")}};
  return VSAValue::Dictionary{{"statusFile", VSAValue("read")}, {"status", *status}};
}

VSAValue VSAStateDump::work() {
  VSAValue list = VSAValue::array();
  for (const auto& s : VSAProgressLog::active())
    list.append(VSAValue::Dictionary{{"task", VSAValue(s.task)},
                                     {"done", VSAValue(s.done)},
                                     {"total", VSAValue(s.total)},
                                     {"unit", VSAValue(s.unit)},
                                     {"bytes", VSAValue(s.bytes)},
                                     {"seconds", VSAValue(s.seconds)}});
  return list;
}

// The database with its write-ahead log and shared-memory index.
VSAValue VSAStateDump::database() {
  std::string path = VSAPathJoin(context_.globalConfiguration->libraryDirectory(),
                                 kVSACodeSigningDatabaseFileName);
  uint64_t bytes = 0;
  for (const char* suffix : {"", "-wal", "-shm"}) {
    struct stat st;
    if (context_.fileSystem->lstat(path + suffix, &st) == 0) bytes += st.st_size;
  }
  return VSAValue::Dictionary{{"path", VSAValue(path)}, {"bytes", VSAValue(bytes)}};
}

std::string VSAStateDump::statePath() const {
  return VSAPathJoin(context_.systemRoot.runDirectory(), kVSAStateFileName);
}

bool VSAStateDump::publish(const VSAValue& state) {
  log(state);
  std::string text = VSAJSON::print(state) + "\n";
  VSAErrorRef error;
  if (context_.fileManager->writeFileAtomicallyAtURL(
          statePath(), std::vector<uint8_t>(text.begin(), text.end()), 0644, std::nullopt, &error))
    return true;
  VSALogIn(VSALogCategory::Daemon, kVSALogError, "dumpState", "Failed to write state to %@: %@",
           statePath(), error);
  return false;
}

void VSAStateDump::log(const VSAValue& state) {
  for (const auto& [key, value] : *state.dictionaryValue())
    VSALogIn(VSALogCategory::Daemon, kVSALogNotice, "dumpState", "State: %@: %@", key,
             VSAJSON::print(value, false));
}
