// The legacy code-signing migrations and the reconciliation that follows
// them, as the container migrator runs them during a client-requested data
// migration, recording their markers in the system migration status. Code
// signing does the work; declaring the call here keeps the migrator below
// code signing. The daemon context owns the implementation and keeps it
// alive as long as the migrator.
#pragma once

class VSACommandQueue;
class VSAMigrationStatus;

class VSACodeSigningMigrationPass {
 public:
  virtual ~VSACodeSigningMigrationPass() = default;

  // True when every step succeeded; deletions it decides go on `commandQueue`.
  virtual bool performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
      VSACommandQueue& commandQueue, VSAMigrationStatus& status) = 0;
};
