#include "codesigning/VSASQLiteDB.h"

#include <sqlite3.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <filesystem>

#include "base/VSACrash.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "platform/VSAPrivateFile.h"

namespace {
constexpr const char* kOrigin = "VSASQLiteDB";

constexpr const char* kSchema =
    "PRAGMA locking_mode = EXCLUSIVE;PRAGMA journal_mode = WAL;PRAGMA foreign_keys = ON;PRAGMA "
    "auto_vacuum = FULL;CREATE TABLE IF NOT EXISTS code_signing_info(id INTEGER PRIMARY KEY "
    "AUTOINCREMENT,code_signing_id_text TEXT NOT NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT "
    "0,placeholder INTEGER NOT NULL DEFAULT 0,registered_by_caller INTEGER NOT NULL DEFAULT "
    "0,data_container_class INTEGER NOT NULL DEFAULT 0);CREATE TABLE IF NOT EXISTS "
    "code_signing_data(id INTEGER PRIMARY KEY AUTOINCREMENT,cs_info_id INTEGER NOT NULL "
    "UNIQUE,data BLOB NOT NULL,FOREIGN KEY(cs_info_id) REFERENCES code_signing_info(id) ON DELETE "
    "CASCADE);CREATE TABLE IF NOT EXISTS child_bundles(id INTEGER PRIMARY KEY "
    "AUTOINCREMENT,child_code_signing_id_text TEXT NOT NULL UNIQUE,parent_id INTEGER NOT "
    "NULL,FOREIGN KEY(parent_id) REFERENCES code_signing_info(id) ON DELETE CASCADE);CREATE INDEX "
    "IF NOT EXISTS code_signing_id_text_idx ON code_signing_info(code_signing_id_text);CREATE "
    "INDEX IF NOT EXISTS cs_info_id_idx ON code_signing_data(cs_info_id);CREATE INDEX IF NOT "
    "EXISTS parent_id_idx ON child_bundles(parent_id);";

constexpr const char* kSelectOne =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM "
    "code_signing_info, code_signing_data WHERE code_signing_info.id = "
    "code_signing_data.cs_info_id AND code_signing_info.code_signing_id_text = ?;";
constexpr const char* kSelectClass =
    "SELECT code_signing_info.data_container_class FROM code_signing_info, code_signing_data "
    "WHERE code_signing_info.id = code_signing_data.cs_info_id AND "
    "code_signing_info.code_signing_id_text = ?;";
constexpr const char* kEnumerateAll =
    "SELECT code_signing_data.data, code_signing_info.invalid, code_signing_info.placeholder, "
    "code_signing_info.registered_by_caller, code_signing_info.data_container_class, "
    "code_signing_info.code_signing_id_text FROM code_signing_info, code_signing_data WHERE "
    "code_signing_info.id = code_signing_data.cs_info_id;";
constexpr const char* kAllIdentifiers =
    "SELECT code_signing_info.code_signing_id_text FROM code_signing_info;";
constexpr const char* kParentOfChild =
    "SELECT code_signing_info.code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "child_bundles.child_code_signing_id_text = ? AND "
    "child_bundles.parent_id=code_signing_info.id;";
constexpr const char* kChildrenOfParent =
    "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info WHERE "
    "code_signing_info.code_signing_id_text = ? AND child_bundles.parent_id=code_signing_info.id;";
constexpr const char* kUpdateInfo =
    "UPDATE code_signing_info SET invalid=?, placeholder=?, registered_by_caller=?, "
    "data_container_class=? WHERE code_signing_id_text=?;";
constexpr const char* kInsertInfo =
    "INSERT INTO code_signing_info (invalid, placeholder, registered_by_caller, "
    "data_container_class, code_signing_id_text) VALUES (?, ?, ?, ?, ?);";
constexpr const char* kStoreData =
    "INSERT OR REPLACE INTO code_signing_data (cs_info_id, data) SELECT id, ? FROM "
    "code_signing_info WHERE code_signing_id_text = ?;";
constexpr const char* kLinkChild =
    "INSERT OR REPLACE INTO child_bundles (parent_id, child_code_signing_id_text) SELECT id, ? "
    "FROM code_signing_info WHERE code_signing_id_text = ?;";
constexpr const char* kDeleteOne = "DELETE FROM code_signing_info WHERE code_signing_id_text=?;";
constexpr const char* kInvalidateOne =
    "UPDATE code_signing_info SET invalid=1 WHERE code_signing_id_text = ?;";
constexpr const char* kDropAdvanceCopies =
    "DELETE FROM code_signing_info WHERE (placeholder & ?) > 0;";

template <typename... A>
VSAErrorRef dbError(VSAResultCode code, const char* function, const char* format,
                    const A&... args) {
  auto e = VSAError::make(code, nullptr, function, __LINE__, format, args...);
  // "Not found" is an everyday answer (most identifiers have no children):
  // it is only worth a debug line.
  int level = code == VSAResult::kNotFoundInDatabase ? kVSALogDebug : kVSALogError;
  VSALogIn(VSALogCategory::Database, level, function, "%@", e->message());
  return e;
}
}  // namespace

// A prepared statement borrowed from the database's cache (or prepared when
// the cache has none for this SQL) and handed back reset on every path.
class VSASQLiteDB::Statement {
 public:
  Statement(VSASQLiteDB& db, const char* sql, const char* kind, VSAErrorRef* error)
      : db_(db), sql_(sql) {
    stmt_ = db.takeCachedStatement(sql);
    if (stmt_) return;
    if (sqlite3_prepare_v3(db.db_, sql, -1, SQLITE_PREPARE_PERSISTENT, &stmt_, nullptr) !=
        SQLITE_OK) {
      VSASetError(error, dbError(VSAResult::kDatabaseFailed, "sqlite3_prepare",
                                 "sqlite3_prepare(%s) for %@ failed: %s", kind, db.url_,
                                 sqlite3_errmsg(db.db_)));
      sqlite3_finalize(stmt_);
      stmt_ = nullptr;
    }
  }
  ~Statement() {
    if (!stmt_) return;
    sqlite3_reset(stmt_);
    sqlite3_clear_bindings(stmt_);
    db_.returnCachedStatement(sql_, stmt_);
  }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;
  explicit operator bool() const { return stmt_ != nullptr; }
  sqlite3_stmt* get() const { return stmt_; }
  bool bindText(int index, const std::string& text, const char* what, VSAErrorRef* error) {
    if (sqlite3_bind_text(stmt_, index, text.c_str(), static_cast<int>(text.size()),
                          SQLITE_TRANSIENT) == SQLITE_OK)
      return true;
    VSASetError(error, dbError(VSAResult::kDatabaseFailed, "sqlite3_bind_text",
                               "sqlite3_bind_text for %s=%@ at %@ failed: %s", what, text, db_.url_,
                               sqlite3_errmsg(db_.db_)));
    return false;
  }
  // Steps once; SQLITE_ROW or SQLITE_DONE are success.
  int step(VSAErrorRef* error) {
    int rc = sqlite3_step(stmt_);
    if (rc != SQLITE_ROW && rc != SQLITE_DONE)
      VSASetError(error,
                  dbError(VSAResult::kDatabaseFailed, "sqlite3_step",
                          "sqlite3_step for %@ failed: %s", db_.url_, sqlite3_errmsg(db_.db_)));
    return rc;
  }
  std::optional<std::string> text(int column) {
    const unsigned char* t = sqlite3_column_text(stmt_, column);
    if (!t) return std::nullopt;
    return std::string(reinterpret_cast<const char*>(t), sqlite3_column_bytes(stmt_, column));
  }

 private:
  VSASQLiteDB& db_;
  const char* sql_;
  sqlite3_stmt* stmt_ = nullptr;
};

sqlite3_stmt* VSASQLiteDB::takeCachedStatement(const char* sql) {
  auto it = statements_.find(std::string_view(sql));
  if (it == statements_.end()) return nullptr;
  sqlite3_stmt* stmt = it->second;
  statements_.erase(it);
  return stmt;
}

void VSASQLiteDB::returnCachedStatement(const char* sql, sqlite3_stmt* stmt) {
  // A nested use of the same SQL prepared a second copy; only one is kept.
  if (!db_ || !statements_.emplace(sql, stmt).second) sqlite3_finalize(stmt);
}

void VSASQLiteDB::finalizeCachedStatements() {
  for (auto& [sql, stmt] : statements_)
    if (sqlite3_finalize(stmt) != SQLITE_OK)
      VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin,
               "sqlite3_finalize for %@ failed: %s", url_, sqlite3_errmsg(db_));
  statements_.clear();
}

VSASQLiteDB::VSASQLiteDB(const std::string& parentDirectory)
    : url_(VSAPathJoin(parentDirectory, kVSACodeSigningDatabaseFileName)),
      db_(openDBWithURL(url_)) {}

VSASQLiteDB::~VSASQLiteDB() {
  closeDB();
  std::error_code ignored;
  if (!scratchDirectory_.empty()) std::filesystem::remove_all(scratchDirectory_, ignored);
}

sqlite3* VSASQLiteDB::openDBWithURL(const std::string& path) {
  // The database holds every app's entitlements: root's alone. SQLite gives
  // its journal files the database's mode, so the file exists with 0600
  // before they do; files left wider by an older daemon are narrowed.
  for (const char* suffix : {"", "-wal", "-shm"}) {
    if (int rc = VSAMakeFileOwnerOnly(path + suffix, suffix[0] == 0))
      VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "Could not make %@%s private: %s",
               path, suffix, std::strerror(rc));
  }
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  if (rc != SQLITE_OK) {
    VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "opening %@ failed: %s", path,
             db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
    sqlite3_close(db);
    VSACrash(VSAFormat("Failed to open database, err = %d", rc));
  }
  char* message = nullptr;
  rc = sqlite3_exec(db, kSchema, nullptr, nullptr, &message);
  if (rc != SQLITE_OK) {
    VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "table create for %@ failed: %s",
             path, message ? message : sqlite3_errstr(rc));
    sqlite3_free(message);
    sqlite3_close(db);
    VSACrash(VSAFormat("Failed to initialize database, err = %d", rc));
  }
  VSALogIn(VSALogCategory::Database, kVSALogDebug, kOrigin, "opening %@", path);
  return db;
}

std::unique_ptr<VSASQLiteDB> VSASQLiteDB::openReadOnly(const std::string& parentDirectory,
                                                       VSAErrorRef* error) {
  namespace fs = std::filesystem;
  std::string path = VSAPathJoin(parentDirectory, kVSACodeSigningDatabaseFileName);
  std::string scratch = (fs::temp_directory_path() / "vessa-db-XXXXXX").string();
  if (!::mkdtemp(scratch.data())) {
    VSASetError(error,
                dbError(VSAResult::kDatabaseFailed, "openReadOnly",
                        "no scratch directory for a copy of %@: %s", path, std::strerror(errno)));
    return nullptr;
  }
  std::string copy = VSAPathJoin(scratch, kVSACodeSigningDatabaseFileName);
  std::error_code ec;
  fs::copy_file(path, copy, ec);
  if (!ec && fs::exists(path + "-wal")) fs::copy_file(path + "-wal", copy + "-wal", ec);
  sqlite3* db = nullptr;
  int rc =
      ec ? SQLITE_CANTOPEN : sqlite3_open_v2(copy.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr);
  if (rc == SQLITE_OK)
    rc = sqlite3_exec(db, "SELECT count(*) FROM sqlite_master;", nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) {
    VSASetError(error,
                dbError(VSAResult::kDatabaseFailed, "openReadOnly", "opening %@ failed: %s", path,
                        ec   ? ec.message().c_str()
                        : db ? sqlite3_errmsg(db)
                             : sqlite3_errstr(rc)));
    sqlite3_close(db);
    fs::remove_all(scratch, ec);
    return nullptr;
  }
  std::unique_ptr<VSASQLiteDB> opened(new VSASQLiteDB(path, db));
  opened->scratchDirectory_ = scratch;
  return opened;
}

std::optional<std::string> VSASQLiteDB::integrityCheck(VSAErrorRef* error) {
  Statement s(*this, "PRAGMA integrity_check;", "integrity check", error);
  if (!s) return std::nullopt;
  std::string result;
  int rc;
  while ((rc = s.step(error)) == SQLITE_ROW) {
    auto line = s.text(0);
    result += (result.empty() ? "" : "\n") + line.value_or("");
  }
  if (rc != SQLITE_DONE) return std::nullopt;
  return result;
}

uint64_t VSASQLiteDB::changeCount() const {
  return changesOfClosedConnections_ +
         (db_ ? static_cast<uint64_t>(sqlite3_total_changes64(db_)) : 0);
}

void VSASQLiteDB::closeDB() {
  if (!db_) return;
  changesOfClosedConnections_ += static_cast<uint64_t>(sqlite3_total_changes64(db_)) + 1;
  VSALogIn(VSALogCategory::Database, kVSALogDebug, kOrigin, "closing %@", url_);
  finalizeCachedStatements();
  if (int rc = sqlite3_close(db_))
    VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "sqlite3_close for %@ failed: %d",
             url_, rc);
  db_ = nullptr;
}

bool VSASQLiteDB::_sqliteExec(const char* sql, VSAErrorRef* error) {
  char* message = nullptr;
  if (sqlite3_exec(db_, sql, nullptr, nullptr, &message) == SQLITE_OK) return true;
  VSASetError(error, dbError(VSAResult::kDatabaseFailed, "_sqliteExec", "%@ on %@ failed: %s", sql,
                             url_, message ? message : sqlite3_errmsg(db_)));
  sqlite3_free(message);
  return false;
}

// Runs `body` between BEGIN and COMMIT; rolls back on failure or exception.
bool VSASQLiteDB::transaction(const std::function<bool(VSAErrorRef*)>& body, VSAErrorRef* error) {
  if (!_sqliteExec("BEGIN;", error)) {
    VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "failed _sqliteExec begin");
    return false;
  }
  bool ok = false;
  try {
    ok = body(error) && _sqliteExec("COMMIT;", error);
    if (!ok) VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "failed _sqliteExec commit");
  } catch (const std::exception& e) {
    VSASetError(error, dbError(VSAResult::kExceptionInTransaction, "transaction",
                               "Got exception: %@ : %@", "std::exception", e.what()));
  }
  if (!ok && !_sqliteExec("ROLLBACK;", nullptr))
    VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "failed _sqliteExec rollback");
  return ok;
}

// ---- Queries ----------------------------------------------------------------

bool VSASQLiteDB::isNotFound(const VSAErrorRef& e) {
  return e && e->domain() == kVSAErrorDomain &&
         e->code() == static_cast<int64_t>(VSAResult::kNotFoundInDatabase);
}

bool VSASQLiteDB::_performSingleParameterQuery(const char* sql, const std::string& input,
                                               int expectedChanges, VSAErrorRef* error) {
  return performTextQuery(sql, "delete", {{input, "identifier"}}, expectedChanges, error);
}

bool VSASQLiteDB::_performTwoParameterQuery(const char* sql, const std::string& one,
                                            const std::string& two, int expectedChanges,
                                            VSAErrorRef* error) {
  return performTextQuery(sql, "insert",
                          {{one, "child_code_signing_id_text"}, {two, "code_signing_id_text"}},
                          expectedChanges, error);
}

// Prepares, binds the texts in order, steps once and, unless
// `expectedChanges` is -1, checks the change count.
bool VSASQLiteDB::performTextQuery(const char* sql, const char* kind,
                                   const std::vector<std::pair<std::string, const char*>>& texts,
                                   int expectedChanges, VSAErrorRef* error) {
  Statement s(*this, sql, kind, error);
  if (!s) return false;
  for (size_t i = 0; i < texts.size(); ++i)
    if (!s.bindText(static_cast<int>(i + 1), texts[i].first, texts[i].second, error)) return false;
  if (s.step(error) != SQLITE_DONE) return false;
  int changes = sqlite3_changes(db_);
  if (expectedChanges >= 0 && changes != expectedChanges) {
    VSASetError(error, dbError(VSAResult::kUnexpectedChangeCount, "performTextQuery",
                               "sqlite3_changes for %s in %@: %d, but expecting %d", sql, url_,
                               changes, expectedChanges));
    return false;
  }
  return true;
}

bool VSASQLiteDB::_performInsertOrUpdateQuery(const char* sql, const VSACodeSigningEntry& e,
                                              const std::string& identifier, VSAErrorRef* error) {
  Statement s(*this, sql, sql == kInsertInfo ? "insert" : "update", error);
  if (!s) return false;
  int flags = (e.isPlaceholder() ? 1 : 0) | (e.isAdvanceCopy() ? 2 : 0);
  auto bindInt = [&](int index, int64_t value, const std::string& what) {
    if (sqlite3_bind_int64(s.get(), index, value) == SQLITE_OK) return true;
    VSASetError(error, dbError(VSAResult::kDatabaseFailed, "sqlite3_bind_int",
                               "%@ at %@ failed: %s", what, url_, sqlite3_errmsg(db_)));
    return false;
  };
  if (!bindInt(1, e.isInvalid(), VSAFormat("sqlite3_bind_int for invalid=%d", e.isInvalid())) ||
      !bindInt(2, flags,
               VSAFormat("sqlite3_bind_int for placeholder=%d, advance_copy=%d (flags=%d)",
                         e.isPlaceholder(), e.isAdvanceCopy(), flags)) ||
      !bindInt(
          3, e.isRegisteredByCaller(),
          VSAFormat("sqlite3_bind_int for registered_by_caller=%d", e.isRegisteredByCaller())) ||
      !bindInt(
          4, static_cast<int64_t>(e.dataContainerClass()),
          VSAFormat("sqlite3_bind_int for data_container_class=%llu", e.dataContainerClass())) ||
      !s.bindText(5, identifier, "code_signing_id", error) || s.step(error) != SQLITE_DONE)
    return false;
  int changes = sqlite3_changes(db_);
  if (changes != 1) {
    VSASetError(error,
                dbError(VSAResult::kUnexpectedChangeCount, "_performInsertOrUpdateQuery",
                        "sqlite3_changes for %s in %@: %d, but expecting 1", sql, url_, changes));
    return false;
  }
  return true;
}

bool VSASQLiteDB::_insertCodeSigningInfo(const VSACodeSigningEntry& entry,
                                         const std::string& identifier, VSAErrorRef* error) {
  VSAErrorRef updateError;
  if (_performInsertOrUpdateQuery(kUpdateInfo, entry, identifier, &updateError)) return true;
  if (!updateError ||
      updateError->code() != static_cast<int64_t>(VSAResult::kUnexpectedChangeCount)) {
    VSASetError(error, dbError(VSAResult::kDatabaseFailed, "_insertCodeSigningInfo",
                               "Error performing UPDATE operation for %@", identifier));
    return false;
  }
  if (_performInsertOrUpdateQuery(kInsertInfo, entry, identifier, error)) return true;
  VSASetError(error, dbError(VSAResult::kDatabaseFailed, "_insertCodeSigningInfo",
                             "Error performing INSERT operation for %@", identifier));
  return false;
}

bool VSASQLiteDB::_insertCodeSigningData(const VSACodeSigningEntry& entry,
                                         const std::string& identifier, VSAErrorRef* error) {
  VSAErrorRef plistError;
  auto blob = VSAPlist::serialize(entry.codeSigningInfo(), VSAPlist::Format::Binary, &plistError);
  if (!blob) {
    VSASetError(error, dbError(VSAResult::kDatabaseFailed, "_insertCodeSigningData",
                               "Error creating NSData from code signing info: %@", plistError));
    return false;
  }
  Statement s(*this, kStoreData, "insert", error);
  if (!s) return false;
  if (sqlite3_bind_blob64(s.get(), 1, blob->data(), blob->size(), SQLITE_TRANSIENT) != SQLITE_OK) {
    VSASetError(error, dbError(VSAResult::kDatabaseFailed, "_insertCodeSigningData",
                               "sqlite3_bind_blob64 for codeSigningInfoData at %@ failed: %s", url_,
                               sqlite3_errmsg(db_)));
    return false;
  }
  return s.bindText(2, identifier, "code_signing_id_text", error) && s.step(error) == SQLITE_DONE;
}

bool VSASQLiteDB::addCodeSigningEntry(const VSACodeSigningEntry* entry,
                                      const std::string* identifier, VSAErrorRef* error) {
  if (!entry || !identifier) {
    VSASetError(error, dbError(VSAResult::kOutOfRange, "addCodeSigningEntry",
                               "codeSigningEntry %@ and identifier %@ cannot be nil", entry,
                               identifier ? *identifier : std::string("(null)")));
    return false;
  }
  return transaction(
      [&](VSAErrorRef* e) {
        if (!_insertCodeSigningInfo(*entry, *identifier, e) ||
            !_insertCodeSigningData(*entry, *identifier, e))
          return false;
        for (const std::string& child :
             entry->childBundleIdentifiers().value_or(std::vector<std::string>{})) {
          if (!_performTwoParameterQuery(kLinkChild, child, *identifier, -1, e)) {
            VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin,
                     "Error performing INSERT operation for child %@", child);
            return false;
          }
        }
        return true;
      },
      error);
}

std::optional<VSACodeSigningEntry> VSASQLiteDB::_codeSigningEntryFromStatementRow(
    Statement& s, VSAErrorRef* error) {
  const void* blob = sqlite3_column_blob(s.get(), 0);
  int size = sqlite3_column_bytes(s.get(), 0);
  auto info =
      blob ? VSAPlist::parse(static_cast<const uint8_t*>(blob), size, nullptr) : std::nullopt;
  if (!info || !info->isDictionary()) {
    VSASetError(error, dbError(VSAResult::kDatabaseFailed, "_codeSigningEntryFromStatementRow",
                               "Error formatting info data from DB"));
    VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin,
             "Failed to create code signing entry from statement row");
    return std::nullopt;
  }
  VSACodeSigningEntry entry(std::move(*info));
  int flags = sqlite3_column_int(s.get(), 2);
  entry.setInvalid(sqlite3_column_int(s.get(), 1) != 0);
  entry.setPlaceholder(flags & 1);
  entry.setAdvanceCopy(flags & 2);
  entry.setRegisteredByCaller(sqlite3_column_int(s.get(), 3) != 0);
  entry.setDataContainerClass(static_cast<VSAContainerClass>(sqlite3_column_int64(s.get(), 4)));
  return entry;
}

bool VSASQLiteDB::fillChildren(VSACodeSigningEntry& entry, const std::string& identifier,
                               VSAErrorRef* error) {
  VSAErrorRef childError;
  auto children = childIdentifiersForParentIdentifier(identifier, &childError);
  if (children) {
    entry.setChildBundleIdentifiers(std::move(*children));
  } else if (!isNotFound(childError)) {
    VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "Error retrieving childBundleIds: %@",
             childError);
    VSASetError(error, childError);
    return false;
  }
  return true;
}

bool VSASQLiteDB::stepToIdentifierRow(Statement& s, const std::string& identifier,
                                      VSAErrorRef* error) {
  if (!s || !s.bindText(1, identifier, "code_signing_id_text", error)) return false;
  int rc = s.step(error);
  if (rc == SQLITE_DONE)
    VSASetError(error,
                dbError(VSAResult::kNotFoundInDatabase, "_selectCodeSigningEntryWithIdentifier",
                        "Identifier: \"%@\" Not Found in DB", identifier));
  return rc == SQLITE_ROW;
}

std::optional<VSACodeSigningEntry> VSASQLiteDB::codeSigningEntryWithIdentifier(
    const std::string& identifier, VSAErrorRef* error) {
  std::optional<VSACodeSigningEntry> entry;
  {
    Statement s(*this, kSelectOne, "select", error);
    if (!stepToIdentifierRow(s, identifier, error)) return std::nullopt;
    entry = _codeSigningEntryFromStatementRow(s, error);
  }
  if (!entry || !fillChildren(*entry, identifier, error)) return std::nullopt;
  return entry;
}

std::optional<VSAContainerClass> VSASQLiteDB::dataContainerClassWithIdentifier(
    const std::string& identifier, VSAErrorRef* error) {
  Statement s(*this, kSelectClass, "select", error);
  if (!stepToIdentifierRow(s, identifier, error)) return std::nullopt;
  return static_cast<VSAContainerClass>(sqlite3_column_int64(s.get(), 0));
}

bool VSASQLiteDB::deleteCodeSigningEntryWithIdentifier(const std::string* identifier,
                                                       VSAErrorRef* error) {
  if (!identifier) {
    VSASetError(error, dbError(VSAResult::kOutOfRange, "deleteCodeSigningEntryWithIdentifier",
                               "\bidentifier %@ cannot be nil", "(null)"));
    return false;
  }
  if (_performSingleParameterQuery(kDeleteOne, *identifier, 1, error)) return true;
  VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin,
           "failed to delete from code_signing_info");
  return false;
}

bool VSASQLiteDB::invalidateCodeSigningWithIdentifier(const std::string& identifier,
                                                      VSAErrorRef* error) {
  if (_performSingleParameterQuery(kInvalidateOne, identifier, -1, error)) return true;
  VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin, "failed to invalidate identifier %@",
           identifier);
  return false;
}

bool VSASQLiteDB::invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier,
                                                                   VSAErrorRef* error) {
  return transaction(
      [&](VSAErrorRef* e) {
        VSAErrorRef childError;
        auto children = childIdentifiersForParentIdentifier(identifier, &childError);
        if (!children && !isNotFound(childError)) {
          VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin,
                   "Error retrieving child bundles ids from DB with identifier %@ : %@", identifier,
                   childError);
          VSASetError(e, childError);
          return false;
        }
        for (const std::string& child : children.value_or(std::vector<std::string>{})) {
          VSALogIn(VSALogCategory::Database, kVSALogNotice, kOrigin,
                   "Invalidating code signing info for %@ child: %@", identifier, child);
          VSAErrorRef invalidateError;
          if (!invalidateCodeSigningWithIdentifier(child, &invalidateError)) {
            VSALogIn(VSALogCategory::Database, kVSALogError, kOrigin,
                     "Failed to invalidate code signing info for %@ child %@ : %@", identifier,
                     child, invalidateError);
            VSASetError(e, invalidateError);
            return false;
          }
        }
        return invalidateCodeSigningWithIdentifier(identifier, e);
      },
      error);
}

bool VSASQLiteDB::deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(VSAErrorRef* error) {
  Statement s(*this, kDropAdvanceCopies, "delete", error);
  if (!s) return false;
  if (sqlite3_bind_int(s.get(), 1, 2) != SQLITE_OK) {
    VSASetError(error, dbError(VSAResult::kDatabaseFailed, "deleteAllAdvanceCopies",
                               "sqlite3_bind_text for flags=%d at %@ failed: %s", 2, url_,
                               sqlite3_errmsg(db_)));
    return false;
  }
  if (s.step(error) != SQLITE_DONE) return false;
  VSALogIn(VSALogCategory::Database, kVSALogNotice, kOrigin,
           "Deleted %d advance copies of code signing info.", sqlite3_changes(db_));
  return true;
}

std::optional<std::string> VSASQLiteDB::parentIdentifierForChildIdentifier(const std::string& child,
                                                                           VSAErrorRef* error) {
  Statement s(*this, kParentOfChild, "select", error);
  if (!s || !s.bindText(1, child, "child_code_signing_id_text", error)) return std::nullopt;
  int rc = s.step(error);
  if (rc == SQLITE_DONE) {
    VSASetError(error, dbError(VSAResult::kNotFoundInDatabase, "parentIdentifierForChildIdentifier",
                               "Parent identifier for: \"%@\" Not Found in DB", child));
    return std::nullopt;
  }
  if (rc != SQLITE_ROW) return std::nullopt;
  auto parent = s.text(0);
  if (!parent)
    VSASetError(error, dbError(VSAResult::kAllocationFailed, "parentIdentifierForChildIdentifier",
                               "Failed to allocate parentIdentifier for text: %s", "(null)"));
  return parent;
}

std::optional<std::vector<std::string>> VSASQLiteDB::childIdentifiersForParentIdentifier(
    const std::string& parent, VSAErrorRef* error) {
  Statement s(*this, kChildrenOfParent, "select", error);
  if (!s || !s.bindText(1, parent, "code_signing_id_text", error)) return std::nullopt;
  std::vector<std::string> children;
  int rc;
  while ((rc = s.step(error)) == SQLITE_ROW) {
    auto child = s.text(0);
    if (!child) {
      VSASetError(error,
                  dbError(VSAResult::kAllocationFailed, "childIdentifiersForParentIdentifier",
                          "Failed to allocate thisChildBundleId for text: %s", "(null)"));
      return std::nullopt;
    }
    children.push_back(std::move(*child));
  }
  if (rc != SQLITE_DONE) return std::nullopt;
  if (children.empty()) {
    VSASetError(error,
                dbError(VSAResult::kNotFoundInDatabase, "childIdentifiersForParentIdentifier",
                        "Children for parent identifier: \"%@\" Not Found in DB", parent));
    return std::nullopt;
  }
  return children;
}

std::optional<std::vector<std::string>> VSASQLiteDB::identifiersWithError(VSAErrorRef* error) {
  Statement s(*this, kAllIdentifiers, "select", error);
  if (!s) return std::nullopt;
  std::vector<std::string> out;
  int rc;
  while ((rc = s.step(error)) == SQLITE_ROW)
    if (auto t = s.text(0)) out.push_back(std::move(*t));
  if (rc != SQLITE_DONE) return std::nullopt;
  return out;
}

VSAErrorRef VSASQLiteDB::enumerateIdentifiersAndCodeSigningInfoUsingBlock(
    const std::function<void(const std::string&, const VSACodeSigningEntry&)>& block) {
  VSAErrorRef error;
  std::vector<std::pair<std::string, VSACodeSigningEntry>> rows;
  {
    Statement s(*this, kEnumerateAll, "select", &error);
    if (!s) return error;
    int rc;
    while ((rc = s.step(&error)) == SQLITE_ROW) {
      auto entry = _codeSigningEntryFromStatementRow(s, &error);
      if (!entry) return error;
      auto identifier = s.text(5);
      if (!identifier)
        return dbError(VSAResult::kDatabaseFailed, "enumerateIdentifiersAndCodeSigningInfo",
                       "Error retrieving code_signing_id_text from DB");
      rows.emplace_back(std::move(*identifier), std::move(*entry));
    }
    if (rc != SQLITE_DONE) return error;
  }
  // Children are read, and the block called, after the walk's statement is done.
  for (auto& [identifier, entry] : rows) {
    if (!fillChildren(entry, identifier, &error)) return error;
    block(identifier, entry);
  }
  return nullptr;
}
