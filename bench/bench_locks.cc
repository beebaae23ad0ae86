// Uncontended lock + unlock of the lock table against std::shared_mutex.
#include <shared_mutex>

#include "VSABenchRatio.h"
#include "base/VSALocks.h"

static VSALocks table;

static void BM_SharedMutexReadLockUnlock(benchmark::State& state) {
  std::shared_mutex m;
  for (auto _ : state) {
    m.lock_shared();
    m.unlock_shared();
  }
}
BENCHMARK(BM_SharedMutexReadLockUnlock);

static void BM_IdentifierReadLockUnlock(benchmark::State& state) {
  VSAValue key("8F0C7E3A-5B1D-4C9E-A2F4-6D3B1E0C9A7F");
  for (auto _ : state) {
    table.lock_identifier_read(key);
    table.unlock_identifier(key);
  }
}
BENCHMARK(BM_IdentifierReadLockUnlock);

static void BM_AllIdentifiersReadLockUnlock(benchmark::State& state) {
  for (auto _ : state) {
    table.lock_all_identifiers_read();
    table.unlock_all_identifiers();
  }
}
BENCHMARK(BM_AllIdentifiersReadLockUnlock);

int main(int argc, char** argv) {
  return VSARunWithRatios(
      argc, argv,
      {{"BM_IdentifierReadLockUnlock", "BM_SharedMutexReadLockUnlock", 0.25},
       {"BM_AllIdentifiersReadLockUnlock", "BM_SharedMutexReadLockUnlock", 0.25}});
}
