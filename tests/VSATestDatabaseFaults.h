// Faults of the code-signing database, made from outside while no daemon
// context holds the file (a daemon holds it alone while it runs).
#pragma once

#include <sqlite3.h>

#include <string>
#include <vector>

// Makes the database at `path` refuse (or, with `refuse` false, accept
// again) every write of the entries of `identifiers`, as a full disk would
// refuse it; reads stay as they are. Answers sqlite's message, empty on
// success.
inline std::string VSARefuseEntryWritesAt(const std::string& path,
                                          const std::vector<std::string>& identifiers,
                                          bool refuse) {
  std::string list;
  for (const auto& id : identifiers) list += (list.empty() ? "'" : ",'") + id + "'";
  std::string sql;
  for (const char* event : {"INSERT", "UPDATE"}) {
    std::string name = std::string("vessa_test_refuse_") + event;
    sql += "DROP TRIGGER IF EXISTS " + name + ";";
    if (refuse)
      sql += "CREATE TRIGGER " + name + " BEFORE " + event +
             " ON code_signing_info WHEN NEW.code_signing_id_text IN (" + list +
             ") BEGIN SELECT RAISE(ABORT, 'database or disk is full'); END;";
  }
  sqlite3* db = nullptr;
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
