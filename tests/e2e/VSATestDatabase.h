// The code-signing database of a stopped test daemon, changed from outside:
// a daemon holds the file alone while it runs, so tests stop it first.
#pragma once

#include <sqlite3.h>

#include <string>

#include "e2e/VSATestDaemon.h"

// Makes the database refuse (or, with `refuse` false, accept again) every
// write of `identifier`'s entry, as a full disk would refuse it; reads stay
// as they are. Answers sqlite's message, empty on success.
inline std::string VSARefuseEntryWrites(VSATestDaemon& d, const std::string& identifier,
                                        bool refuse) {
  std::string sql;
  for (const char* event : {"INSERT", "UPDATE"}) {
    std::string name = std::string("vessa_test_refuse_") + event;
    sql += "DROP TRIGGER IF EXISTS " + name + ";";
    if (refuse)
      sql += "CREATE TRIGGER " + name + " BEFORE " + event +
             " ON code_signing_info WHEN NEW.code_signing_id_text = '" + identifier +
             "' BEGIN SELECT RAISE(ABORT, 'database or disk is full'); END;";
  }
  sqlite3* db = nullptr;
  std::string path = d.path("/private/var/root/Library/Vessa/containers.sqlite3");
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    std::string message = db ? sqlite3_errmsg(db) : "cannot open " + path;
    sqlite3_close(db);
    return message;
  }
  char* error = nullptr;
  std::string message;
  if (sqlite3_exec(db, sql.c_str(), nullptr, nullptr, &error) != SQLITE_OK)
    message = error ? error : "failed";
  sqlite3_free(error);
  sqlite3_close(db);
  return message;
}
