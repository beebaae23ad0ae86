#include "platform/VSASandboxService.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

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

const VSASandboxService::Table& VSASandboxService::load(uid_t uid) {
  auto it = tables_.find(uid);
  if (it != tables_.end()) return it->second;
  Table items;
  VSAErrorRef error;
  if (auto dict = VSA_dictionaryWithContentsOfURL(tablePath(uid), 0, &error)) {
    const VSAValue* list = dict->get("Items");
    for (const VSAValue& v : list && list->isArray() ? *list->arrayValue() : VSAValue::Array{}) {
      const VSAValue *type = v.get("ItemType"), *id = v.get("Identifier"), *cls = v.get("Class"),
                     *persona = v.get("PersonaID"), *path = v.get("Path");
      if (!type || !id || !id->isString() || !cls || !path || !path->isString()) continue;
      VSASandboxItem item{type->uint64Value().value_or(0), *id->stringValue(),
                          cls->uint64Value().value_or(VSAClass::kUndefined),
                          static_cast<int32_t>(persona ? persona->int64Value().value_or(0) : 0),
                          *path->stringValue()};
      items[{item.identifier, item.containerClass, item.personaID}] = std::move(item);
    }
  }
  return tables_[uid] = std::move(items);
}

int VSASandboxService::write(uid_t uid, const Table& items) {
  VSAValue::Array list;
  list.reserve(items.size());
  for (const auto& [key, i] : items)
    list.push_back(VSAValue::Dictionary{{"ItemType", VSAValue(i.itemType)},
                                        {"Identifier", VSAValue(i.identifier)},
                                        {"Class", VSAValue(i.containerClass)},
                                        {"PersonaID", VSAValue(static_cast<int64_t>(i.personaID))},
                                        {"Path", VSAValue(i.path)}});
  std::string dir = root_.resolve("/run/vessad/sandbox");
  VSAMakeDirectories(dir, 0700);
  VSAErrorRef error;
  // The table lives as long as the boot, like the kernel's: no flush to disk.
  if (!VSA_writeToURL(VSAValue::Dictionary{{"Items", VSAValue(std::move(list))}}, tablePath(uid),
                      kVSAWriteFileWithoutSync, &error)) {
    VSALog(kVSALogError, "VSASandboxService", "Failed to write container table %@: %@",
           tablePath(uid), error);
    return EIO;
  }
  return 0;
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
    auto took = writePending();
    lock.lock();
    gatherInterval_ = std::clamp<std::chrono::steady_clock::duration>(
        took * 10, std::chrono::milliseconds(100), std::chrono::seconds(2));
  }
}

std::chrono::steady_clock::duration VSASandboxService::writePending() {
  std::lock_guard writing(writeMutex_);
  auto start = std::chrono::steady_clock::now();
  std::map<uid_t, Table> pending;
  {
    std::lock_guard lock(mutex_);
    for (uid_t uid : dirty_) pending[uid] = tables_[uid];
    dirty_.clear();
  }
  for (const auto& [uid, items] : pending) write(uid, items);
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
    load(uid);
    auto& items = tables_[uid];
    std::tuple<std::string, VSAContainerClass, int32_t> key{identifier, containerClass, personaID};
    auto it = items.find(key);
    // Launches and look-ups push the same mapping again and again: only a
    // change makes the table worth rewriting.
    if (path) {
      if (it != items.end() && it->second.itemType == itemType && it->second.path == *path)
        return 0;
      items[key] = {itemType, identifier, containerClass, personaID, *path};
    } else {
      if (it == items.end()) return 0;
      items.erase(it);
    }
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
    for (const auto& [key, item] : load(uid)) items.push_back(item);
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
  const Table& items = load(uid);
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
