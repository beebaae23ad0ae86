#include "platform/VSASandboxService.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "base/VSALog.h"
#include "base/VSAPlist.h"

namespace {
std::string hex(const uint8_t* p, size_t n) {
  static const char* digits = "0123456789abcdef";
  std::string out;
  out.reserve(2 * n);
  for (size_t i = 0; i < n; ++i) {
    out += digits[p[i] >> 4];
    out += digits[p[i] & 15];
  }
  return out;
}
std::string hex(const std::string& s) {
  return hex(reinterpret_cast<const uint8_t*>(s.data()), s.size());
}
}  // namespace

std::optional<uint64_t> VSASandboxItemTypeForClass(VSAContainerClass c) {
  switch (c) {
    case VSAClass::kDataApplication:
      return 1;  // app data
    case VSAClass::kDataPlugin:
      return 2;  // plug-in data
    case VSAClass::kDataVPNPlugin:
      return 3;  // VPN plug-in data
    case VSAClass::kAppGroup:
      return 4;  // app group
    case VSAClass::kDataRelayService:
      return 5;  // relay service data
    case VSAClass::kDataInternalDaemon:
      return 6;  // internal daemon data
    case VSAClass::kDataTempDir:
      return 7;  // temporary directory
    case VSAClass::kSystemData:
      return 8;  // system data
    case VSAClass::kSystemGroup:
      return 9;  // system group
    default:
      return std::nullopt;
  }
}

VSASandboxService::VSASandboxService(VSASystemRoot root)
    : root_(std::move(root)), writer_([this] { writerLoop(); }) {}

VSASandboxService::~VSASandboxService() {
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  changed_.notify_all();
  writer_.join();
  writePending();
}

std::string VSASandboxService::tablePath(uid_t uid) const {
  return root_.resolve("/run/vessad/sandbox/" + std::to_string(uid) + ".plist");
}

std::string VSASandboxService::logPath(uid_t uid) const {
  return root_.resolve("/run/vessad/sandbox/" + std::to_string(uid) + ".log");
}

namespace {
// The log is appended to until it outgrows the table it changes (or this).
constexpr uint64_t kMinimumLogBytes = 64 << 10;
// What is read of a table or its log: the daemon's own files, below a
// directory only root reaches; a bound all the same.
constexpr uint64_t kSandboxFileLimit = uint64_t{1} << 30;

VSAValue::Dictionary itemDictionary(const VSASandboxItem& i) {
  return VSAValue::Dictionary{{"ItemType", VSAValue(i.itemType)},
                              {"Identifier", VSAValue(i.identifier)},
                              {"Class", VSAValue(i.containerClass)},
                              {"PersonaID", VSAValue(static_cast<int64_t>(i.personaID))},
                              {"Path", VSAValue(i.path)}};
}

std::optional<VSASandboxItem> itemOfDictionary(const VSAValue& v, bool needsPath) {
  const VSAValue *type = v.get("ItemType"), *id = v.get("Identifier"), *cls = v.get("Class"),
                 *persona = v.get("PersonaID"), *path = v.get("Path");
  if (!type || !id || !id->isString() || !cls || (path && !path->isString()) ||
      (needsPath && !path))
    return std::nullopt;
  return VSASandboxItem{type->uint64Value().value_or(0), *id->stringValue(),
                        cls->uint64Value().value_or(VSAClass::kUndefined),
                        static_cast<int32_t>(persona ? persona->int64Value().value_or(0) : 0),
                        path ? *path->stringValue() : std::string()};
}
}  // namespace

void VSASandboxService::apply(Table& items, const Change& change) {
  Key key{change.item.identifier, change.item.containerClass, change.item.personaID};
  if (change.removal)
    items.erase(key);
  else
    items[key] = change.item;
}

VSASandboxService::UserTable* VSASandboxService::load(uid_t uid, int* rc) {
  auto it = tables_.find(uid);
  if (it != tables_.end()) return &it->second;
  // The log is read before the table: a writer that writes the table whole
  // in between removes the log after the table is in place, so the table
  // read second holds every change of the log read first.
  std::vector<uint8_t> log, bytes;
  int logRead = VSAReadRegularFile(logPath(uid), kSandboxFileLimit, &log);
  int tableRead = VSAReadRegularFile(tablePath(uid), kSandboxFileLimit, &bytes);
  for (int read : {logRead, tableRead}) {
    if (read != 0 && read != ENOENT) {
      VSALog(kVSALogError, "VSASandboxService", "Failed to read container table of uid %u: %s", uid,
             std::strerror(read));
      *rc = read;
      return nullptr;
    }
  }
  UserTable table;
  if (tableRead == 0) {
    table.tableBytes = bytes.size();
    auto dict = VSAPlist::parse(bytes, nullptr);
    const VSAValue* list = dict ? dict->get("Items") : nullptr;
    for (const VSAValue& v : list && list->isArray() ? *list->arrayValue() : VSAValue::Array{}) {
      if (auto item = itemOfDictionary(v, true))
        table.items[{item->identifier, item->containerClass, item->personaID}] = std::move(*item);
    }
    const VSAValue* sequence = dict ? dict->get("Sequence") : nullptr;
    table.sequence = sequence ? sequence->uint64Value().value_or(0) : 0;
    // A table that does not parse is written again, whole, at the next write.
    if (!list || !list->isArray()) table.rewrite = true;
  }
  if (logRead == 0 && !replayLog(log, table)) table.rewrite = true;
  return &(tables_[uid] = std::move(table));
}

bool VSASandboxService::replayLog(const std::vector<uint8_t>& bytes, UserTable& table) {
  size_t at = 0;
  while (at < bytes.size()) {
    if (bytes.size() - at < 4) return false;
    const uint8_t* p = bytes.data() + at;
    size_t length = size_t{p[0]} << 24 | size_t{p[1]} << 16 | size_t{p[2]} << 8 | p[3];
    if (length > bytes.size() - at - 4) return false;
    auto record = VSAPlist::parse(p + 4, length, nullptr);
    const VSAValue* sequence = record ? record->get("Sequence") : nullptr;
    auto item = record ? itemOfDictionary(*record, false) : std::nullopt;
    if (!sequence || !sequence->uint64Value() || !item) return false;
    at += 4 + length;
    table.logBytes = at;
    Change change{*sequence->uint64Value(), std::move(*item), !record->get("Path")};
    // Changes the table already holds (it was written after them) are skipped.
    if (change.sequence <= table.sequence) continue;
    apply(table.items, change);
    table.sequence = change.sequence;
  }
  return true;
}

int64_t VSASandboxService::writeWhole(uid_t uid, const Table& items, uint64_t sequence) {
  VSAValue::Array list;
  list.reserve(items.size());
  for (const auto& [key, i] : items) list.push_back(itemDictionary(i));
  VSAErrorRef error;
  auto bytes = VSAPlist::serialize(
      VSAValue::Dictionary{{"Items", VSAValue(std::move(list))}, {"Sequence", VSAValue(sequence)}},
      VSAPlist::Format::Binary, &error);
  VSAMakeDirectories(root_.resolve("/run/vessad/sandbox"), 0700);
  // The table lives as long as the boot, like the kernel's: no flush to disk.
  if (!bytes || !VSAWriteFileAtomically(tablePath(uid), *bytes, 0644, &error, false)) {
    VSALog(kVSALogError, "VSASandboxService", "Failed to write container table %@: %@",
           tablePath(uid), error);
    return -EIO;
  }
  // The table holds every change the log held: the log starts again. A log
  // that stays (with perhaps a record cut short at its end) must not be
  // appended to: the table is written whole again next time.
  if (::unlink(logPath(uid).c_str()) != 0 && errno != ENOENT &&
      ::truncate(logPath(uid).c_str(), 0) != 0) {
    int e = errno;
    VSALog(kVSALogError, "VSASandboxService", "Failed to empty container table log %@: %s",
           logPath(uid), std::strerror(e));
    return -e;
  }
  return static_cast<int64_t>(bytes->size());
}

int64_t VSASandboxService::appendToLog(uid_t uid, const std::vector<Change>& changes) {
  std::vector<uint8_t> out;
  for (const Change& c : changes) {
    VSAValue::Dictionary record = itemDictionary(c.item);
    if (c.removal) record.erase("Path");
    record["Sequence"] = VSAValue(c.sequence);
    auto bytes =
        VSAPlist::serialize(VSAValue(std::move(record)), VSAPlist::Format::Binary, nullptr);
    if (!bytes) return -EINVAL;
    uint32_t n = static_cast<uint32_t>(bytes->size());
    out.insert(out.end(), {static_cast<uint8_t>(n >> 24), static_cast<uint8_t>(n >> 16),
                           static_cast<uint8_t>(n >> 8), static_cast<uint8_t>(n)});
    out.insert(out.end(), bytes->begin(), bytes->end());
  }
  VSAMakeDirectories(root_.resolve("/run/vessad/sandbox"), 0700);
  int fd =
      ::open(logPath(uid).c_str(), O_WRONLY | O_APPEND | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0644);
  int rc = fd < 0 ? errno : 0;
  for (size_t done = 0; rc == 0 && done < out.size();) {
    ssize_t n = ::write(fd, out.data() + done, out.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) rc = n < 0 ? errno : EIO;
    if (n > 0) done += static_cast<size_t>(n);
  }
  if (fd >= 0) ::close(fd);
  if (rc != 0) {
    VSALog(kVSALogError, "VSASandboxService", "Failed to append to container table log %@: %s",
           logPath(uid), std::strerror(rc));
    return -rc;
  }
  return static_cast<int64_t>(out.size());
}

void VSASandboxService::writerLoop() {
  pthread_setname_np(pthread_self(), "vessa-sandbox");
  std::unique_lock lock(mutex_);
  for (;;) {
    changed_.wait(lock, [this] { return stopping_ || !dirty_.empty(); });
    if (stopping_) return;  // the destructor writes what is left
    changed_.wait_for(lock, gatherInterval_, [this] { return stopping_; });
    if (stopping_) return;
    lock.unlock();
    bool failed = false;
    auto took = writePending(&failed);
    lock.lock();
    gatherInterval_ = failed
                          ? std::chrono::seconds(2)
                          : std::clamp<std::chrono::steady_clock::duration>(
                                took * 10, std::chrono::milliseconds(100), std::chrono::seconds(2));
  }
}

std::chrono::steady_clock::duration VSASandboxService::writePending(bool* failed) {
  std::lock_guard writing(writeMutex_);
  auto start = std::chrono::steady_clock::now();
  std::map<uid_t, Work> pending;
  bool retry = false;
  {
    std::lock_guard lock(mutex_);
    for (uid_t uid : dirty_) {
      UserTable& table = tables_[uid];
      Work work;
      work.changes.swap(table.unwritten);
      work.sequence = table.sequence;
      // Written whole when the log would outgrow the table (or come near
      // what a read takes), or when this batch rewrites a good part of it
      // anyway (a boot's first mappings).
      if (table.rewrite ||
          table.logBytes > std::max<uint64_t>(kMinimumLogBytes,
                                              std::min(table.tableBytes, kSandboxFileLimit / 2)) ||
          work.changes.size() > std::max<size_t>(256, table.items.size() / 4)) {
        work.whole = table.items;
        table.rewrite = false;
      }
      pending.emplace(uid, std::move(work));
    }
    dirty_.clear();
  }
  for (const auto& [uid, work] : pending) {
    int64_t n =
        work.whole ? writeWhole(uid, *work.whole, work.sequence) : appendToLog(uid, work.changes);
    std::lock_guard lock(mutex_);
    UserTable& table = tables_[uid];
    if (n < 0) {
      // The files missed these changes: the table stays changed, and the
      // next write is whole.
      table.rewrite = true;
      dirty_.insert(uid);
      if (failed) *failed = true;
      retry = true;
    } else if (work.whole) {
      table.tableBytes = static_cast<uint64_t>(n);
      table.logBytes = 0;
    } else {
      table.logBytes += static_cast<uint64_t>(n);
    }
  }
  // A failed table waits for the writer even when a flush failed it.
  if (retry) changed_.notify_one();
  return std::chrono::steady_clock::now() - start;
}

void VSASandboxService::flush() { writePending(); }

int VSASandboxService::setUserStateItem(uid_t uid, uint64_t itemType, const std::string& identifier,
                                        VSAContainerClass containerClass, int32_t personaID,
                                        const std::optional<std::string>& path) {
  if (identifier.empty()) return EINVAL;
  bool wake = false;
  {
    std::lock_guard lock(mutex_);
    int rc = 0;
    UserTable* loaded = load(uid, &rc);
    if (!loaded) return rc;
    UserTable& table = *loaded;
    auto it = table.items.find(Key{identifier, containerClass, personaID});
    // Launches and look-ups push the same mapping again and again: only a
    // change is worth writing.
    if (path && it != table.items.end() && it->second.itemType == itemType &&
        it->second.path == *path)
      return 0;
    if (!path && it == table.items.end()) return 0;
    Change change{++table.sequence,
                  {itemType, identifier, containerClass, personaID, path.value_or(std::string())},
                  !path};
    apply(table.items, change);
    table.unwritten.push_back(std::move(change));
    // The writer is woken by the first change only: while it gathers, more
    // changes join the same write without a wake-up (a context switch) each.
    wake = dirty_.empty();
    dirty_.insert(uid);
  }
  if (wake) changed_.notify_one();
  return 0;
}

int VSASandboxService::iterateUserStateItems(
    uid_t uid, const std::function<bool(const VSASandboxItem&)>& block) {
  std::vector<VSASandboxItem> items;
  {
    std::lock_guard lock(mutex_);
    int rc = 0;
    const UserTable* table = load(uid, &rc);
    if (!table) return rc;
    for (const auto& [key, item] : table->items) items.push_back(item);
  }
  for (const auto& i : items)
    if (!block(i)) break;
  return 0;
}

std::optional<VSASandboxItem> VSASandboxService::userStateItem(uid_t uid,
                                                               const std::string& identifier,
                                                               VSAContainerClass containerClass,
                                                               int32_t personaID) {
  std::lock_guard lock(mutex_);
  int rc = 0;
  const UserTable* table = load(uid, &rc);
  if (!table) return std::nullopt;
  const Table& items = table->items;
  auto it = items.find({identifier, containerClass, personaID});
  if (it == items.end()) return std::nullopt;
  return it->second;
}

bool VSASandboxService::key(std::string* out) {
  std::lock_guard lock(mutex_);
  if (!key_.empty()) {
    *out = key_;
    return true;
  }
  std::string path = root_.resolve("/run/vessad/sandbox-token.key");
  std::vector<uint8_t> bytes;
  if (auto existing = VSAReadFile(path, nullptr); existing && existing->size() == 32) {
    bytes = *existing;
  } else {
    bytes.resize(32);
    if (RAND_bytes(bytes.data(), 32) != 1) return false;
    VSAMakeDirectories(root_.runDirectory());
    if (!VSAWriteFileAtomically(path, bytes, 0600, nullptr)) return false;
  }
  key_.assign(bytes.begin(), bytes.end());
  *out = key_;
  return true;
}

std::string VSASandboxService::mac(const std::string& extensionClass, const std::string& path,
                                   const VSAAuditToken& auditToken, const std::string& k) const {
  auto token = auditToken.bytes();
  std::string message = extensionClass + '\0' + path + '\0' +
                        std::string(reinterpret_cast<const char*>(token.data()), token.size());
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  HMAC(EVP_sha256(), k.data(), static_cast<int>(k.size()),
       reinterpret_cast<const unsigned char*>(message.data()), message.size(), digest, &length);
  return hex(digest, length);
}

std::optional<std::string> VSASandboxService::issueFileExtension(const std::string& extensionClass,
                                                                 const std::string& path,
                                                                 const VSAAuditToken& auditToken) {
  std::string k;
  if (extensionClass.find(';') != std::string::npos || !key(&k)) return std::nullopt;
  auto token = auditToken.bytes();
  return extensionClass + ";" + hex(path) + ";" + hex(token.data(), token.size()) + ";" +
         mac(extensionClass, path, auditToken, k);
}

bool VSASandboxService::verifyFileExtension(const std::string& token,
                                            const std::string& extensionClass,
                                            const std::string& path,
                                            const VSAAuditToken& auditToken) {
  std::string k;
  if (!key(&k)) return false;
  auto expected = issueFileExtension(extensionClass, path, auditToken);
  return expected && expected->size() == token.size() &&
         CRYPTO_memcmp(expected->data(), token.data(), token.size()) == 0;
}
