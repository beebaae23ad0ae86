// Handlers of the client-requested migrations: the system-wide data
// migration (24) and the current mobile user's data migration (30).
#include "base/VSALog.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"

void VSAHandleDataMigration(const VSAValue&, VSAValue&, VSAClientConnection& connection,
                            VSAResultCode* result) {
  if (!connection.performDataMigratorMigrationForClientConnection(result))
    VSALog(kVSALogError, "VSAHandleDataMigration", "Failed to perform data migration : %@",
           *result);
}

void VSAHandlePerUserDataMigration(const VSAValue&, VSAValue&, VSAClientConnection& connection,
                                   VSAResultCode* result) {
  if (!connection.performPerUserDataMigrationForClientConnection(result))
    VSALog(kVSALogError, "VSAHandlePerUserDataMigration",
           "Failed to perform per-user data migration : %@", *result);
}
