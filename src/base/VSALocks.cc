#include "base/VSALocks.h"

#include <pthread.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <set>
#include <string_view>

#include "base/VSALog.h"

namespace {

struct LockRecord {
  pthread_rwlock_t lock;
  uint64_t refCount;
  // 0 free, -1 write, n > 0 readers: a check on the per-key lock, changed
  // only under the table's mutex so that it costs no locked instruction.
  int32_t lockState;
  std::string key;
  uint64_t hash;
  // Links in the table's list of idle records (those in the map with
  // refCount 0: a caller counts itself in right after finding its record),
  // oldest first.
  LockRecord* idlePrev;
  LockRecord* idleNext;
};

// Keys are mostly 36-character UUID strings: hash them eight bytes at a time
// with independent multiplies (the chain is short; probing absorbs the odd
// collision).
uint64_t hashKey(std::string_view s) {
  static constexpr uint64_t kMul[4] = {0x9E3779B97F4A7C15ull, 0xC2B2AE3D27D4EB4Full,
                                       0x165667B19E3779F9ull, 0xD6E8FEB86659FD93ull};
  uint64_t h = s.size() * 0xFF51AFD7ED558CCDull;
  size_t i = 0;
  for (; i + 8 <= s.size(); i += 8) {
    uint64_t w;
    std::memcpy(&w, s.data() + i, 8);
    h += (w ^ (w >> 29)) * kMul[(i >> 3) & 3];
  }
  uint64_t tail = 0;
  for (size_t k = i; k < s.size(); ++k) tail = (tail << 8) | static_cast<uint8_t>(s[k]);
  h += tail * 0xC4CEB9FE1A85EC53ull;
  return h ^ (h >> 32);
}

// The key -> record map: open addressing with linear probing and
// backward-shift deletion, each record carrying its hash, so that one lock
// or unlock hashes its key once and allocates nothing in steady state. It
// holds the keys in use and the table's idle records.
class LockMap {
 public:
  LockMap() : slots_(16, nullptr) {}
  size_t size() const { return size_; }

  LockRecord* find(std::string_view key, uint64_t hash) const {
    for (size_t i = hash & mask();; i = (i + 1) & mask()) {
      LockRecord* r = slots_[i];
      if (!r) return nullptr;
      if (r->hash == hash && r->key == key) return r;
    }
  }
  void insert(LockRecord* record) {
    if ((size_ + 1) * 4 > slots_.size() * 3) grow();
    place(record);
    ++size_;
  }
  void erase(LockRecord* record) {
    size_t i = record->hash & mask();
    while (slots_[i] != record) i = (i + 1) & mask();
    // Shift later members of the probe run back into the hole.
    for (size_t j = (i + 1) & mask(); slots_[j]; j = (j + 1) & mask()) {
      size_t home = slots_[j]->hash & mask();
      if (((j - home) & mask()) >= ((j - i) & mask())) {
        slots_[i] = slots_[j];
        i = j;
      }
    }
    slots_[i] = nullptr;
    --size_;
  }

 private:
  size_t mask() const { return slots_.size() - 1; }
  void place(LockRecord* record) {
    size_t i = record->hash & mask();
    while (slots_[i]) i = (i + 1) & mask();
    slots_[i] = record;
  }
  void grow() {
    std::vector<LockRecord*> old(slots_.size() * 2, nullptr);
    old.swap(slots_);
    for (LockRecord* r : old)
      if (r) place(r);
  }

  std::vector<LockRecord*> slots_;
  size_t size_ = 0;
};

// A record whose last holder left stays in the map, idle, so that a key
// locked again soon (the usual pattern: look-up after look-up of one
// container) finds its record and lock ready. Beyond this many idle records
// the oldest is destroyed.
constexpr size_t kIdleRecords = 64;

// A condition variable that knows whether anybody waits, so that the many
// wake-ups the protocol asks for cost nothing when nobody does.
struct Condition {
  pthread_cond_t cond = PTHREAD_COND_INITIALIZER;
  int waiters = 0;
  void wait(pthread_mutex_t* mutex) {
    ++waiters;
    pthread_cond_wait(&cond, mutex);
    --waiters;
  }
  void signal() {
    if (waiters) pthread_cond_signal(&cond);
  }
  void broadcast() {
    if (waiters) pthread_cond_broadcast(&cond);
  }
};

struct LockTable {
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  Condition globalWriterCondition;
  Condition globalReaderCondition;
  Condition identifierWriterCondition;
  Condition identifierReaderCondition;
  LockMap* identifierToLockMap = nullptr;
  size_t recordsInUse = 0;  // records with holders or waiters
  size_t idleCount = 0;
  LockRecord* idleOldest = nullptr;
  LockRecord* idleNewest = nullptr;
  // Each in its own eight bytes: a compiler tests adjacent counters with one
  // wide load, and that load, right after a store to one of them, stalls
  // until the store has left the store buffer.
  alignas(8) uint32_t identifierReaderCount = 0;
  alignas(8) int32_t allReaderWriterState = 0;
  alignas(8) uint32_t identifierWriterCount = 0;
};

[[noreturn]] void assertionFailed(const char* function, const char* condition) {
  VSALogIn(VSALogCategory::Locking, kVSALogFault, function, "Assertion failed: %s", condition);
  VSALogger::shared().flush();
  std::fprintf(stderr, "%s: Assertion failed: %s\n", function, condition);
  std::abort();
}

#define VSA_LOCK_ASSERT(condition)                           \
  do {                                                       \
    if (!(condition)) assertionFailed(__func__, #condition); \
  } while (0)

[[noreturn]] void unknownParameter(const char* function) {
  VSALogIn(VSALogCategory::Locking, kVSALogError, function, "Unknown parameter type!");
  VSALogger::shared().flush();
  std::fprintf(stderr, "%s: Unknown parameter type!\n", function);
  std::abort();
}

const char* mode(bool writing) { return writing ? "writing" : "reading"; }

// Records the grant of `record`'s lock in its shadow state. Called under the
// table's mutex.
void noteGranted(LockRecord* record, bool writing) {
  if (writing) {
    VSA_LOCK_ASSERT(record->lockState == 0);
    record->lockState = -1;
  } else {
    VSA_LOCK_ASSERT(record->lockState >= 0);
    ++record->lockState;
  }
}

// Idle list upkeep, under the table's mutex.
void unlinkIdle(LockTable& t, LockRecord* r) {
  (r->idlePrev ? r->idlePrev->idleNext : t.idleOldest) = r->idleNext;
  (r->idleNext ? r->idleNext->idlePrev : t.idleNewest) = r->idlePrev;
  --t.idleCount;
}

void linkIdle(LockTable& t, LockRecord* r) {
  r->idleNext = nullptr;
  r->idlePrev = t.idleNewest;
  (t.idleNewest ? t.idleNewest->idleNext : t.idleOldest) = r;
  t.idleNewest = r;
  ++t.idleCount;
}

// Destroys the oldest idle records beyond the kept number. A record is only
// ever reused for its own key, so a key's lock is one lock object for its
// whole life (which is what lock-order checkers expect).
void trimIdle(LockTable& t) {
  while (t.idleCount > kIdleRecords) {
    LockRecord* r = t.idleOldest;
    unlinkIdle(t, r);
    t.identifierToLockMap->erase(r);
    pthread_rwlock_destroy(&r->lock);
    delete r;
  }
}

// The record for `key`: found in use or idle, or created. Called under the
// table's mutex.
LockRecord* recordForKey(LockTable& t, const std::string& key) {
  if (!t.identifierToLockMap) t.identifierToLockMap = new LockMap();
  uint64_t hash = hashKey(key);
  LockRecord* lockPtr = t.identifierToLockMap->find(key, hash);
  if (lockPtr) {
    if (lockPtr->refCount == 0) {
      unlinkIdle(t, lockPtr);
      ++t.recordsInUse;
    }
    return lockPtr;
  }
  lockPtr = new LockRecord;
  pthread_rwlock_init(&lockPtr->lock, nullptr);
  lockPtr->refCount = 0;
  lockPtr->lockState = 0;
  lockPtr->key.assign(key);
  lockPtr->hash = hash;
  t.identifierToLockMap->insert(lockPtr);
  ++t.recordsInUse;
  return lockPtr;
}

void take_one_lock(LockTable& t, const std::string& key, bool writing) {
  VSALogIn(VSALogCategory::Locking, kVSALogDebug, "take_one_lock", "Waiting to lock %@ for %s", key,
           mode(writing));
  pthread_mutex_lock(&t.mutex);
  if (writing) {
    while (t.allReaderWriterState != 0) t.identifierWriterCondition.wait(&t.mutex);
    ++t.identifierWriterCount;
  } else {
    while (t.allReaderWriterState == -1) t.identifierReaderCondition.wait(&t.mutex);
    ++t.identifierReaderCount;
  }
  LockRecord* lockPtr = recordForKey(t, key);
  ++lockPtr->refCount;
  // The key's lock is free (or shared with readers) most of the time: take it
  // here without blocking. Otherwise wait for it outside the table's mutex and
  // come back only to note the grant.
  int taken =
      writing ? pthread_rwlock_trywrlock(&lockPtr->lock) : pthread_rwlock_tryrdlock(&lockPtr->lock);
  if (taken != 0) {
    pthread_mutex_unlock(&t.mutex);
    if (writing) {
      pthread_rwlock_wrlock(&lockPtr->lock);
    } else {
      pthread_rwlock_rdlock(&lockPtr->lock);
    }
    pthread_mutex_lock(&t.mutex);
  }
  noteGranted(lockPtr, writing);
  pthread_mutex_unlock(&t.mutex);
  VSALogIn(VSALogCategory::Locking, kVSALogDebug, "take_one_lock", "Got lock on identifier %@",
           key);
}

bool allCountersZero(LockTable& t) {
  return t.identifierWriterCount == 0 && t.identifierReaderCount == 0 &&
         t.allReaderWriterState == 0;
}

void unlock_one_lock(LockTable& t, const std::string& key) {
  pthread_mutex_lock(&t.mutex);
  VSA_LOCK_ASSERT(t.identifierToLockMap);
  LockRecord* lockPtr = t.identifierToLockMap->find(key, hashKey(key));
  VSA_LOCK_ASSERT(lockPtr);
  VSA_LOCK_ASSERT(lockPtr->lockState != 0);
  if (lockPtr->lockState != -1) {
    --lockPtr->lockState;
    VSA_LOCK_ASSERT(t.allReaderWriterState >= 0);
    VSA_LOCK_ASSERT(t.identifierReaderCount > 0);
    --t.identifierReaderCount;
    if (allCountersZero(t)) t.globalWriterCondition.signal();
  } else {
    lockPtr->lockState = 0;
    VSA_LOCK_ASSERT(t.allReaderWriterState == 0);
    VSA_LOCK_ASSERT(t.identifierWriterCount > 0);
    --t.identifierWriterCount;
    if (allCountersZero(t)) t.globalWriterCondition.signal();
    if (t.identifierWriterCount == 0 && t.allReaderWriterState != -1)
      t.globalReaderCondition.broadcast();
  }
  --lockPtr->refCount;
  pthread_rwlock_unlock(&lockPtr->lock);
  VSALogIn(VSALogCategory::Locking, kVSALogDebug, "unlock_one_lock", "Unlocked identifier %@", key);
  if (lockPtr->refCount == 0) {
    VSALogIn(VSALogCategory::Locking, kVSALogDebug, "unlock_one_lock",
             "Destroying lock for identifier %@", key);
    VSA_LOCK_ASSERT(0 == lockPtr->lockState);
    // Nobody holds or waits for the key: its record goes idle (and the
    // oldest idle one is destroyed when there are too many).
    --t.recordsInUse;
    linkIdle(t, lockPtr);
    trimIdle(t);
  }
  pthread_mutex_unlock(&t.mutex);
}

// The distinct keys of `param` in the order they are to be taken
// (ascending) or released (descending).
std::vector<std::string> orderedKeys(const VSAValue& param, bool descending, const char* function) {
  if (const std::string* s = param.stringValue()) return {*s};
  const VSAValue::Array* array = param.arrayValue();
  if (!array) unknownParameter(function);
  std::vector<std::string> keys;
  keys.reserve(array->size());
  for (const VSAValue& v : *array) {
    if (!v.isString()) unknownParameter(function);
    keys.push_back(*v.stringValue());
  }
  std::sort(keys.begin(), keys.end());
  keys.erase(std::unique(keys.begin(), keys.end()), keys.end());
  if (descending) std::reverse(keys.begin(), keys.end());
  return keys;
}

void _lock_identifier(LockTable& t, const VSAValue& param, bool writing) {
  if (const std::string* key = param.stringValue()) return take_one_lock(t, *key, writing);
  for (const std::string& key : orderedKeys(param, false, "_lock_identifier"))
    take_one_lock(t, key, writing);
}

void _lock_all_identifiers(LockTable& t, bool writing) {
  VSALogIn(VSALogCategory::Locking, kVSALogDebug, "_lock_all_identifiers",
           "Waiting to lock all identifiers for %s", mode(writing));
  pthread_mutex_lock(&t.mutex);
  if (writing) {
    while (!allCountersZero(t)) t.globalWriterCondition.wait(&t.mutex);
    t.allReaderWriterState = -1;
  } else {
    while (t.identifierWriterCount != 0 || t.allReaderWriterState == -1)
      t.globalReaderCondition.wait(&t.mutex);
    ++t.allReaderWriterState;
  }
  VSALogIn(VSALogCategory::Locking, kVSALogDebug, "_lock_all_identifiers",
           "Locked all identifiers for %s", mode(writing));
  pthread_mutex_unlock(&t.mutex);
}

}  // namespace

// The table's records live as long as the table: a record is freed when it
// leaves the idle list, and whatever is left (idle records) goes with the table.
struct VSALocks::Table : LockTable {
  ~Table() {
    for (LockRecord* r = idleOldest; r;) {
      LockRecord* next = r->idleNext;
      pthread_rwlock_destroy(&r->lock);
      delete r;
      r = next;
    }
    delete identifierToLockMap;
  }
};

VSALocks::VSALocks() : table_(std::make_unique<Table>()) {}

VSALocks::~VSALocks() = default;

void VSALocks::lock_identifier_read(const VSAValue& param) {
  _lock_identifier(*table_, param, false);
}
void VSALocks::lock_identifier_write(const VSAValue& param) {
  _lock_identifier(*table_, param, true);
}

void VSALocks::unlock_identifier(const VSAValue& param) {
  LockTable& t = *table_;
  if (const std::string* key = param.stringValue()) return unlock_one_lock(t, *key);
  for (const std::string& key : orderedKeys(param, true, "unlock_identifier"))
    unlock_one_lock(t, key);
}

void VSALocks::lock_all_identifiers_read() { _lock_all_identifiers(*table_, false); }
void VSALocks::lock_all_identifiers_write() { _lock_all_identifiers(*table_, true); }

void VSALocks::unlock_all_identifiers() {
  LockTable& t = *table_;
  pthread_mutex_lock(&t.mutex);
  if (t.allReaderWriterState != -1) {
    VSA_LOCK_ASSERT(t.allReaderWriterState > 0);
    --t.allReaderWriterState;
    if (t.allReaderWriterState == 0) t.identifierWriterCondition.broadcast();
    if (allCountersZero(t)) t.globalWriterCondition.signal();
  } else {
    t.allReaderWriterState = 0;
    t.globalWriterCondition.signal();
    t.globalReaderCondition.broadcast();
    t.identifierWriterCondition.broadcast();
    t.identifierReaderCondition.broadcast();
  }
  pthread_mutex_unlock(&t.mutex);
  VSALogIn(VSALogCategory::Locking, kVSALogDebug, "unlock_all_identifiers",
           "Unlocked all identifiers");
}

VSALockTableState VSALocks::snapshot() const {
  LockTable& t = *table_;
  pthread_mutex_lock(&t.mutex);
  VSALockTableState s{t.recordsInUse, t.identifierReaderCount, t.identifierWriterCount,
                      t.allReaderWriterState, t.idleCount};
  pthread_mutex_unlock(&t.mutex);
  return s;
}

VSAIdentifierLockGuard::VSAIdentifierLockGuard(VSALocks& locks, VSAValue keys, bool writing,
                                               bool useLocking)
    : locks_(locks), keys_(std::move(keys)), held_(useLocking) {
  if (!held_) return;
  if (writing) {
    locks_.lock_identifier_write(keys_);
  } else {
    locks_.lock_identifier_read(keys_);
  }
}

VSAIdentifierLockGuard::~VSAIdentifierLockGuard() {
  if (held_) locks_.unlock_identifier(keys_);
}

VSAAllIdentifiersLockGuard::VSAAllIdentifiersLockGuard(VSALocks& locks, bool writing,
                                                       bool useLocking)
    : locks_(locks), held_(useLocking) {
  if (!held_) return;
  if (writing) {
    locks_.lock_all_identifiers_write();
  } else {
    locks_.lock_all_identifiers_read();
  }
}

VSAAllIdentifiersLockGuard::~VSAAllIdentifiersLockGuard() {
  if (held_) locks_.unlock_all_identifiers();
}
