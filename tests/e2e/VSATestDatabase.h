// The code-signing database of a stopped test daemon, changed from outside:
// a daemon holds the file alone while it runs, so tests stop it first.
#pragma once

#include <string>

#include "VSATestDatabaseFaults.h"
#include "e2e/VSATestDaemon.h"

// Makes the daemon's database refuse (or, with `refuse` false, accept again)
// every write of `identifier`'s entry; see VSARefuseEntryWritesAt.
inline std::string VSARefuseEntryWrites(VSATestDaemon& d, const std::string& identifier,
                                        bool refuse) {
  return VSARefuseEntryWritesAt(d.path("/private/var/root/Library/Vessa/containers.sqlite3"),
                                {identifier}, refuse);
}
