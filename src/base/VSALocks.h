// VSALocks, the lock table: reader/writer locks per container key plus one
// reader/writer lock over all keys.
//
// Keys are container UUID strings (upper-case text form). A call takes one
// key or an array of keys; an array is sorted ascending and de-duplicated, so
// every caller takes any set of keys in the same global order (no deadlock
// between multi-key callers), and is released in descending order.
//
// Compatibility (may the row be granted while the column is held?):
//                     id read  id write  other key  all read  all write
//   identifier read    yes      no        yes        yes       no
//   identifier write   no       no        yes        no        no
//   all, read          yes      no        read yes   yes       no
//   all, write         no       no        no         no        no
// There is no writer preference: a waiting all-identifiers writer lets new
// identifier traffic in. Lock order: all identifiers before any identifier
// lock; nothing is re-entrant (asking again for a held write lock
// deadlocks). Callers that may already hold a lock take a `useLocking` flag.
//
// Misuse (a key that is not a string or array of strings, an unlock of a key
// that is not locked, a broken counter) aborts the daemon with the failed
// condition's text. Thread-safe; per-key waits happen outside the table's
// mutex. Prefer the RAII guards below, which release on every path.
//
// One table per daemon instance (the daemon context owns it and hands it to
// every module that locks), so several daemons in one process never share a
// lock. Whoever locks keeps the table alive until it has unlocked.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "base/VSAValue.h"

// Introspection for tests and diagnostics.
struct VSALockTableState {
  size_t recordCount;  // keys held or waited for
  uint32_t identifierReaderCount;
  uint32_t identifierWriterCount;
  int32_t allReaderWriterState;
  size_t idleRecords;  // records of released keys kept for their next use
};

class VSALocks {
 public:
  VSALocks();
  ~VSALocks();
  VSALocks(const VSALocks&) = delete;
  VSALocks& operator=(const VSALocks&) = delete;

  void lock_identifier_read(const VSAValue& param);
  void lock_identifier_write(const VSAValue& param);
  void unlock_identifier(const VSAValue& param);
  void lock_all_identifiers_read();
  void lock_all_identifiers_write();
  void unlock_all_identifiers();

  VSALockTableState snapshot() const;

 private:
  struct Table;
  std::unique_ptr<Table> table_;
};

// Holds identifier locks for a scope. With useLocking false it takes nothing.
class VSAIdentifierLockGuard {
 public:
  VSAIdentifierLockGuard(VSALocks& locks, VSAValue keys, bool writing, bool useLocking = true);
  ~VSAIdentifierLockGuard();
  VSAIdentifierLockGuard(const VSAIdentifierLockGuard&) = delete;
  VSAIdentifierLockGuard& operator=(const VSAIdentifierLockGuard&) = delete;

 private:
  VSALocks& locks_;
  VSAValue keys_;
  bool held_;
};

// Holds the all-identifiers lock for a scope. With useLocking false it takes nothing.
class VSAAllIdentifiersLockGuard {
 public:
  VSAAllIdentifiersLockGuard(VSALocks& locks, bool writing, bool useLocking = true);
  ~VSAAllIdentifiersLockGuard();
  VSAAllIdentifiersLockGuard(const VSAAllIdentifiersLockGuard&) = delete;
  VSAAllIdentifiersLockGuard& operator=(const VSAAllIdentifiersLockGuard&) = delete;

 private:
  VSALocks& locks_;
  bool held_;
};
