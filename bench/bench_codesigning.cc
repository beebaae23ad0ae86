// Registration and lookup of 10,000 identifiers through the code-signing
// mapping, against raw sqlite3 inserts and selects of the same rows (same
// schema, same binary-plist blobs, one transaction per row) in the same run.
// The store prepares every statement per call by design (no statement
// cache), so the baseline does too; the figure for a select prepared once is
// printed beside it for reference. A third measure: registrations that drop
// a group, each of which rebuilds the group reference counts from every row,
// against a raw sqlite3 scan that reads, decodes and counts the same rows.
// Target: 0.3x for all three.
//   bench_codesigning [COUNT] [WORKDIR]
#include <sqlite3.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>

#include "VSABenchTable.h"
#include "base/VSALog.h"
#include "base/VSAPlist.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSALinuxPersonaService.h"

namespace {
using Clock = std::chrono::steady_clock;
double seconds(Clock::time_point a, Clock::time_point b) {
  return std::chrono::duration<double>(b - a).count();
}

VSAValue infoFor(int i) {
  return VSAValue::Dictionary{
      {kVSAEntitlementsKey,
       VSAValue::Dictionary{{"com.tamsk.security.application-groups",
                             VSAValue("group.bench." + std::to_string(i % 50))}}},
      {"CDHash", VSAValue(std::to_string(i * 7919))}};
}

void exec(sqlite3* db, const char* sql) { sqlite3_exec(db, sql, nullptr, nullptr, nullptr); }
}  // namespace

int main(int argc, char** argv) {
  int count = argc > 1 ? std::atoi(argv[1]) : 10000;
  std::string work = argc > 2 ? argv[2] : "/tmp";
  std::string root = work + "/vessa-bench-cs-" + std::to_string(getpid());
  std::filesystem::create_directories(root + "/etc");
  std::filesystem::create_directories(root + "/private/var/mobile");
  std::ofstream(root + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
  VSALogger::shared().setLevel(kVSALogError);

  // Raw baseline: the same tables, a transaction per row, prepared once.
  std::string rawPath = root + "/raw.sqlite3";
  sqlite3* db = nullptr;
  sqlite3_open(rawPath.c_str(), &db);
  exec(db,
       "PRAGMA locking_mode = EXCLUSIVE;PRAGMA journal_mode = WAL;PRAGMA foreign_keys = ON;"
       "CREATE TABLE code_signing_info(id INTEGER PRIMARY KEY AUTOINCREMENT,code_signing_id_text "
       "TEXT NOT NULL UNIQUE,invalid INTEGER NOT NULL DEFAULT 0,placeholder INTEGER NOT NULL "
       "DEFAULT 0,registered_by_caller INTEGER NOT NULL DEFAULT 0,data_container_class INTEGER "
       "NOT NULL DEFAULT 0);CREATE TABLE code_signing_data(id INTEGER PRIMARY KEY "
       "AUTOINCREMENT,cs_info_id INTEGER NOT NULL UNIQUE,data BLOB NOT NULL);");
  const char* kInsertInfo = "INSERT INTO code_signing_info (code_signing_id_text) VALUES (?);";
  const char* kInsertData = "INSERT INTO code_signing_data (cs_info_id, data) VALUES (?, ?);";
  const char* kSelect =
      "SELECT code_signing_data.data FROM code_signing_info, code_signing_data WHERE "
      "code_signing_info.id = code_signing_data.cs_info_id AND "
      "code_signing_info.code_signing_id_text = ?;";
  auto t0 = Clock::now();
  for (int i = 0; i < count; ++i) {
    std::string id = "com.bench.app" + std::to_string(i);
    auto blob = *VSAPlist::serialize(infoFor(i), VSAPlist::Format::Binary, nullptr);
    exec(db, "BEGIN;");
    sqlite3_stmt* info = nullptr;
    sqlite3_prepare_v2(db, kInsertInfo, -1, &info, nullptr);
    sqlite3_bind_text(info, 1, id.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_step(info);
    sqlite3_finalize(info);
    sqlite3_stmt* data = nullptr;
    sqlite3_prepare_v2(db, kInsertData, -1, &data, nullptr);
    sqlite3_bind_int64(data, 1, sqlite3_last_insert_rowid(db));
    sqlite3_bind_blob64(data, 2, blob.data(), blob.size(), SQLITE_TRANSIENT);
    sqlite3_step(data);
    sqlite3_finalize(data);
    exec(db, "COMMIT;");
  }
  auto t1 = Clock::now();
  size_t rawFound = 0;
  auto readRow = [&](sqlite3_stmt* select) {
    if (sqlite3_step(select) == SQLITE_ROW) {
      auto v = VSAPlist::parse(static_cast<const uint8_t*>(sqlite3_column_blob(select, 0)),
                               sqlite3_column_bytes(select, 0), nullptr);
      rawFound += v.has_value();
    }
  };
  for (int i = 0; i < count; ++i) {
    std::string id = "com.bench.app" + std::to_string(i);
    sqlite3_stmt* select = nullptr;
    sqlite3_prepare_v2(db, kSelect, -1, &select, nullptr);
    sqlite3_bind_text(select, 1, id.c_str(), -1, SQLITE_TRANSIENT);
    readRow(select);
    sqlite3_finalize(select);
  }
  auto t2 = Clock::now();
  sqlite3_stmt* prepared = nullptr;
  sqlite3_prepare_v2(db, kSelect, -1, &prepared, nullptr);
  for (int i = 0; i < count; ++i) {
    std::string id = "com.bench.app" + std::to_string(i);
    sqlite3_bind_text(prepared, 1, id.c_str(), -1, SQLITE_TRANSIENT);
    readRow(prepared);
    sqlite3_reset(prepared);
  }
  auto tPrepared = Clock::now();
  sqlite3_finalize(prepared);
  sqlite3_close(db);

  // The mapping.
  VSASystemRoot sysroot(root);
  auto users = std::make_shared<VSAUserDatabase>(sysroot);
  auto config = std::make_shared<VSAGlobalConfiguration>(
      sysroot, std::make_shared<VSADeviceProperties>(sysroot), users,
      std::make_shared<VSAFileManager>(std::make_shared<VSALinuxFileSystem>(), users));
  auto cache = VSAUserIdentityCache::create(
      {std::make_shared<VSALinuxPersonaService>(sysroot), users, 501, 501, true, nullptr});
  VSACodeSigningMapping mapping(cache, config,
                                std::make_unique<VSASQLiteDB>(config->libraryDirectory()),
                                std::make_shared<VSALocks>());
  VSACommandQueue queue;
  auto t3 = Clock::now();
  for (int i = 0; i < count; ++i) {
    std::string id = "com.bench.app" + std::to_string(i);
    mapping.processCodeSigningInfo(infoFor(i), &id, VSAValue::dictionary(), &queue);
  }
  auto t4 = Clock::now();
  size_t found = 0;
  for (int i = 0; i < count; ++i)
    found +=
        mapping.getCodeSigningInfoForIdentifier("com.bench.app" + std::to_string(i)).has_value();
  auto t5 = Clock::now();

  // Registrations that drop their group: each one counts every row's groups.
  const int drops = 20;
  auto t6 = Clock::now();
  for (int i = 0; i < drops; ++i) {
    std::string id = "com.bench.app" + std::to_string(i);
    VSAValue noGroups = VSAValue::Dictionary{{kVSAEntitlementsKey, VSAValue::dictionary()},
                                             {"CDHash", VSAValue(std::to_string(i))}};
    mapping.processCodeSigningInfo(noGroups, &id, VSAValue::dictionary(), &queue);
  }
  auto t7 = Clock::now();
  sqlite3_open(rawPath.c_str(), &db);
  size_t counted = 0;
  for (int i = 0; i < drops; ++i) {
    std::map<std::string, int> counts;
    sqlite3_stmt* all = nullptr;
    sqlite3_prepare_v2(db,
                       "SELECT code_signing_info.code_signing_id_text, code_signing_data.data FROM "
                       "code_signing_info, code_signing_data WHERE code_signing_info.id = "
                       "code_signing_data.cs_info_id;",
                       -1, &all, nullptr);
    while (sqlite3_step(all) == SQLITE_ROW) {
      std::string id(reinterpret_cast<const char*>(sqlite3_column_text(all, 0)));
      auto v = VSAPlist::parse(static_cast<const uint8_t*>(sqlite3_column_blob(all, 1)),
                               sqlite3_column_bytes(all, 1), nullptr);
      const VSAValue* e = v ? v->get(kVSAEntitlementsKey) : nullptr;
      auto groups = VSACodeSigningMapping::copyApplicationGroupEntitlementForIdentifier(
          id, e, kVSAEntitlementApplicationGroups);
      for (const auto& g : groups.value_or(std::vector<std::string>{})) ++counts[g];
    }
    sqlite3_finalize(all);
    counted += counts.size();
  }
  auto t8 = Clock::now();
  sqlite3_close(db);
  double dropping = seconds(t6, t7), rawScan = seconds(t7, t8);
  std::printf(
      "%d registrations dropping a group over %d rows: %.3fs; raw scans %.3fs (%zu groups)\n",
      drops, count, dropping, rawScan, counted / drops);

  double rawInsert = seconds(t0, t1), rawSelect = seconds(t1, t2);
  double reg = seconds(t3, t4), look = seconds(t4, t5);
  std::printf(
      "%d identifiers: raw insert %.3fs, mapping registration %.3fs; raw select %.3fs, "
      "mapping lookup %.3fs (%zu found); select prepared once %.3fs\n",
      count, rawInsert, reg, rawSelect, look, found, seconds(t2, tPrepared));
  (void)rawFound;
  std::printf("\n%-34s %8s %8s\n", "measure", "ratio", "target");
  std::printf("%-34s %7.2fx %7.2fx %s\n", "registration vs raw insert", rawInsert / reg, 0.8,
              rawInsert / reg >= 0.8 ? "ok" : "BELOW TARGET");
  VSABenchRecord("code-signing registration", "raw sqlite3 inserts", rawInsert / reg, 0.8);
  VSABenchRecord("code-signing lookup", "raw sqlite3 selects", rawSelect / look, 0.3);
  std::printf("%-34s %7.2fx %7.2fx %s\n", "lookup vs raw select", rawSelect / look, 0.3,
              rawSelect / look >= 0.3 ? "ok" : "BELOW TARGET");
  std::printf("%-34s %7.2fx %7.2fx %s\n", "group-dropping reg. vs raw scan", rawScan / dropping,
              0.3, rawScan / dropping >= 0.3 ? "ok" : "BELOW TARGET");
  std::filesystem::remove_all(root);
  return 0;
}
