// Death row: where containers and other trees go to be deleted.
//
// Moving an item there is one rename (into a fresh "temp.XXXXXX" directory,
// so items of the same name stay apart) and cannot half-happen. Emptying
// runs on the daemon's serial background queue
// "com.tamsk.vessad.background" (given by the daemon context, which makes
// one per daemon instance), so two emptyings never overlap, inside a
// transaction that keeps the daemon alive until it has run. An entry that
// cannot be removed is moved to the root's /tmp so that it never blocks the
// others. Thread-safe; holds no identifier lock (nothing on death row is
// reachable through the cache).
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAWorkQueue.h"
#include "model/VSAGlobalConfiguration.h"
#include "platform/VSATransactions.h"

// How an item moves to death row ({.startDeletionThread = true}).
struct VSADeathRowMoveOptions {
  // Start emptying death row once the item is there.
  bool startDeletionThread = false;
  // false leaves the rename unsynced: for items whose move is redone if a
  // crash undoes it (orphans found at boot).
  bool durable = true;
};

class VSADeathRow : public std::enable_shared_from_this<VSADeathRow> {
 public:
  using Completion = std::function<void(VSAResultCode)>;

  VSADeathRow(std::shared_ptr<VSAGlobalConfiguration> configuration,
              std::shared_ptr<VSATransactions> transactions, VSAWorkQueue::Ref backgroundQueue);

  // "com.tamsk.vessad.background": where emptying and other slow cleanups run.
  const VSAWorkQueue::Ref& _sharedBackgroundQueue() const { return backgroundQueue_; }

  // A missing item is success and starts nothing; other failures are 41.
  [[nodiscard]] bool _moveItemAtURLToDeathRow(const std::string& url,
                                              VSADeathRowMoveOptions options, VSAErrorRef* error);
  // Moves the entries of one directory (so their names differ) into one
  // fresh directory, without syncs: for orphans found at boot, whose moves
  // are redone if a crash undoes them. Each failure is logged and the others
  // go on; false when any failed.
  [[nodiscard]] bool _moveEntriesToDeathRowWithoutSync(const std::vector<std::string>& urls);
  // Returns at once; the completion gets the code of the last failure (1 when none).
  // The queued work keeps this object alive until it has run.
  void deleteContainersOnDeathRowWithCompletion(Completion completion);
  // Removes a tree or, failing that, moves it to /tmp.
  [[nodiscard]] bool _removeItemOrMoveToTempAtURL(
      const std::string& url, VSAErrorRef* error,
      const VSAFileManager::RemovalObserver& observer = {});

  // What death row moved aside and nothing removes: the entries of the
  // root's /tmp named as death-row entries are (a container's UUID, or
  // "temp." and six characters), with their sizes. Only reads.
  struct Leftover {
    std::string path;
    uint64_t bytes = 0;
  };
  static std::vector<Leftover> leftoversInTemp(const VSAGlobalConfiguration& configuration);
  [[nodiscard]] static bool isDeathRowEntryName(const std::string& name);

 private:
  static std::string temporaryDirectory(const VSAGlobalConfiguration& configuration);
  VSAResultCode emptyDeathRow();

  std::shared_ptr<VSAGlobalConfiguration> configuration_;
  std::shared_ptr<VSATransactions> transactions_;
  VSAWorkQueue::Ref backgroundQueue_;
};
