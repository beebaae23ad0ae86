// The code-signing database: `containers.sqlite3` in the library directory.
//
// One row per code-signing identifier (flags and data container class), its
// code-signing info dictionary as a binary property-list blob, and the child
// (plug-in) identifiers linked to a parent. Each statement is prepared once,
// kept by its SQL text and reset after every use (the daemon asks for the
// same few queries on every request); multi-statement changes run inside
// BEGIN/COMMIT and roll back on failure. The file is opened in exclusive
// locking mode: a second daemon on the same root cannot use it and stops at
// start-up instead of corrupting it. Not thread-safe: all calls come from the
// code-signing mapping's serial queue.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "codesigning/VSACodeSigningEntry.h"

struct sqlite3;
struct sqlite3_stmt;

inline constexpr const char* kVSACodeSigningDatabaseFileName = "containers.sqlite3";

class VSASQLiteDB {
 public:
  // initWithParentDirectoryURL: opens (and creates) <directory>/containers.sqlite3.
  explicit VSASQLiteDB(const std::string& parentDirectory);
  ~VSASQLiteDB();
  VSASQLiteDB(const VSASQLiteDB&) = delete;
  VSASQLiteDB& operator=(const VSASQLiteDB&) = delete;

  // For a reader that must change nothing (the root checker): opens a
  // private copy of the file and of its write-ahead log, so that SQLite may
  // recover the log as the daemon's next start would, without touching the
  // original; runs no schema. The copy goes with the object. Nothing, with
  // `error`, when it cannot (no file, not a database).
  static std::unique_ptr<VSASQLiteDB> openReadOnly(const std::string& parentDirectory,
                                                   VSAErrorRef* error);
  // SQLite's own consistency check: "ok", or the problems it lists, one a line.
  std::optional<std::string> integrityCheck(VSAErrorRef* error);

  // Opens and initialises the file; ends the process when it cannot.
  static sqlite3* openDBWithURL(const std::string& path);
  void closeDB();
  const std::string& url() const { return url_; }
  // Grows with every row this object's connections insert, update or
  // delete (and when the database is closed): equal values mean nothing
  // was written in between.
  uint64_t changeCount() const;
  // Whether a query's error only says that the identifier has no entry.
  static bool isNotFound(const VSAErrorRef& error);

  bool addCodeSigningEntry(const VSACodeSigningEntry* entry, const std::string* identifier,
                           VSAErrorRef* error);
  std::optional<VSACodeSigningEntry> codeSigningEntryWithIdentifier(const std::string& identifier,
                                                                    VSAErrorRef* error);
  // The stored data container class of an entry (one indexed select: no
  // info to decode, no children to list); not found as the entry above.
  std::optional<VSAContainerClass> dataContainerClassWithIdentifier(const std::string& identifier,
                                                                    VSAErrorRef* error);
  bool deleteCodeSigningEntryWithIdentifier(const std::string* identifier, VSAErrorRef* error);
  bool invalidateCodeSigningWithIdentifier(const std::string& identifier, VSAErrorRef* error);
  bool invalidateCodeSigningForIdentifierAndAllChildren(const std::string& identifier,
                                                        VSAErrorRef* error);
  bool deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(VSAErrorRef* error);
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& child,
                                                                VSAErrorRef* error);
  std::optional<std::vector<std::string>> childIdentifiersForParentIdentifier(
      const std::string& parent, VSAErrorRef* error);
  std::optional<std::vector<std::string>> identifiersWithError(VSAErrorRef* error);
  // Calls `block` once per identifier; answers an error, or null when the walk completed.
  VSAErrorRef enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      const std::function<void(const std::string&, const VSACodeSigningEntry&)>& block);

 private:
  class Statement;
  VSASQLiteDB(std::string url, sqlite3* db) : url_(std::move(url)), db_(db) {}
  std::string scratchDirectory_;  // the private copy of openReadOnly, removed with the object
  bool _sqliteExec(const char* sql, VSAErrorRef* error);
  bool _insertCodeSigningInfo(const VSACodeSigningEntry& entry, const std::string& identifier,
                              VSAErrorRef* error);
  bool _performInsertOrUpdateQuery(const char* sql, const VSACodeSigningEntry& entry,
                                   const std::string& identifier, VSAErrorRef* error);
  bool _insertCodeSigningData(const VSACodeSigningEntry& entry, const std::string& identifier,
                              VSAErrorRef* error);
  bool _performSingleParameterQuery(const char* sql, const std::string& input, int expectedChanges,
                                    VSAErrorRef* error);
  bool performTextQuery(const char* sql, const char* kind,
                        const std::vector<std::pair<std::string, const char*>>& texts,
                        int expectedChanges, VSAErrorRef* error);
  bool _performTwoParameterQuery(const char* sql, const std::string& one, const std::string& two,
                                 int expectedChanges, VSAErrorRef* error);
  std::optional<VSACodeSigningEntry> _codeSigningEntryFromStatementRow(Statement& statement,
                                                                       VSAErrorRef* error);
  bool fillChildren(VSACodeSigningEntry& entry, const std::string& identifier, VSAErrorRef* error);
  // Binds `identifier` to a by-identifier select and steps to its row; a
  // missing row sets the not-found error.
  bool stepToIdentifierRow(Statement& s, const std::string& identifier, VSAErrorRef* error);
  bool transaction(const std::function<bool(VSAErrorRef*)>& body, VSAErrorRef* error);

  sqlite3_stmt* takeCachedStatement(const char* sql);
  void returnCachedStatement(const char* sql, sqlite3_stmt* stmt);
  void finalizeCachedStatements();

  std::string url_;
  sqlite3* db_ = nullptr;
  uint64_t changesOfClosedConnections_ = 0;
  std::map<std::string, sqlite3_stmt*, std::less<>> statements_;  // by SQL text
};
