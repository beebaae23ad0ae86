#include "platform/VSALinuxPersonaService.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

#include "base/VSALog.h"
#include "base/VSAPlist.h"
#include "platform/VSAProcessRecords.h"

namespace {
// How long a watched, kept persona list is used without a look at the file.
constexpr auto kTrustWithoutLooking = std::chrono::seconds(1);

thread_local std::optional<std::pair<pid_t, uint64_t>> tServedProcess;
thread_local VSAPersonaRecordMemo* tServedMemo = nullptr;

std::optional<VSAPersonaAttributes> parseRecord(const VSAValue& record, const VSASystemRoot& root) {
  auto bad = [&](const char* why) {
    VSALogIn(VSALogCategory::Unspecified, kVSALogError, "VSALinuxPersonaService",
             "Ignoring persona record %@: %s", record, why);
    return std::nullopt;
  };
  if (!record.isDictionary()) return bad("not a dictionary");
  VSAPersonaAttributes a;
  const VSAValue* id = record.get("PersonaID");
  if (!id || !id->uint64Value() || *id->uint64Value() > UINT32_MAX)
    return bad("\"PersonaID\" must be an unsigned 32-bit number");
  a.personaID = static_cast<uint32_t>(*id->uint64Value());
  const VSAValue* kind = record.get("Kind");
  std::string k = kind && kind->isString() ? *kind->stringValue() : "";
  if (k == "personal")
    a.kind = VSAPersonaAttributes::Kind::Personal;
  else if (k == "enterprise")
    a.kind = VSAPersonaAttributes::Kind::Enterprise;
  else if (k == "universal")
    a.kind = VSAPersonaAttributes::Kind::Universal;
  else if (k == "system")
    a.kind = VSAPersonaAttributes::Kind::System;
  else
    return bad("\"Kind\" must be personal, enterprise, universal or system");
  if (const VSAValue* s = record.get("UniqueString")) {
    if (!s->isString()) return bad("\"UniqueString\" must be a string");
    a.uniqueString = *s->stringValue();
  }
  if (const VSAValue* list = record.get("BundleIdentifiers")) {
    if (!list->isArray()) return bad("\"BundleIdentifiers\" must be an array of strings");
    std::vector<std::string> ids;
    for (const VSAValue& v : *list->arrayValue()) {
      if (!v.isString()) return bad("\"BundleIdentifiers\" must be an array of strings");
      ids.push_back(*v.stringValue());
    }
    a.bundleIdentifiers = std::move(ids);
  }
  if (const VSAValue* layout = record.get("LayoutPath")) {
    if (!layout->isString() || layout->stringValue()->empty() ||
        layout->stringValue()->front() != '/')
      return bad("\"LayoutPath\" must be an absolute path");
    a.layoutPath = root.resolve(*layout->stringValue());
  }
  return a;
}
}  // namespace

std::string VSAPersonaAttributes::description() const {
  static const char* kinds[] = {"personal", "enterprise", "universal", "system"};
  return VSAFormat("<persona %u %s [%s]>", personaID, kinds[static_cast<int>(kind)],
                   uniqueString ? *uniqueString : std::string("(none)"));
}

std::optional<uint32_t> VSAPersonaRecordMemo::get(
    const std::function<std::optional<uint32_t>()>& read) {
  std::lock_guard lock(mutex_);
  if (!known_) {
    persona_ = read();
    known_ = true;
  }
  return persona_;
}

VSACurrentPersonaScope::VSACurrentPersonaScope(pid_t pid, uint64_t startTime,
                                               VSAPersonaRecordMemo* memo)
    : previous_(tServedProcess), previousMemo_(tServedMemo) {
  tServedProcess = std::make_pair(pid, startTime);
  tServedMemo = memo;
}

VSACurrentPersonaScope::~VSACurrentPersonaScope() {
  tServedProcess = previous_;
  tServedMemo = previousMemo_;
}

VSAPersonaRecordMemo* VSACurrentPersonaScope::currentMemo() { return tServedMemo; }

std::optional<std::pair<pid_t, uint64_t>> VSACurrentPersonaScope::current() {
  return tServedProcess;
}

VSALinuxPersonaService::VSALinuxPersonaService(VSASystemRoot root) : root_(std::move(root)) {}

std::optional<std::vector<VSAPersonaAttributes>> VSALinuxPersonaService::listPersonas() {
  auto now = std::chrono::steady_clock::now();
  uint64_t generation;
  {
    std::lock_guard lock(cacheMutex_);
    if (watched_ && cachedStamp_ && now < trustedUntil_) return cachedPersonas_;
    generation = changesHeard_;
  }
  struct stat st;
  if (stat(personasPath().c_str(), &st) != 0) return readPersonas();  // missing or unreadable
  FileStamp stamp{static_cast<uint64_t>(st.st_dev), static_cast<uint64_t>(st.st_ino),
                  static_cast<uint64_t>(st.st_size), st.st_mtim.tv_sec, st.st_mtim.tv_nsec};
  {
    std::lock_guard lock(cacheMutex_);
    if (cachedStamp_ == stamp) {
      if (generation == changesHeard_) trustedUntil_ = now + kTrustWithoutLooking;
      return cachedPersonas_;
    }
  }
  auto personas = readPersonas();
  if (personas) {
    std::lock_guard lock(cacheMutex_);
    cachedStamp_ = stamp;
    cachedPersonas_ = *personas;
    // A change heard while this file was read may be newer than what was read.
    if (generation == changesHeard_) trustedUntil_ = now + kTrustWithoutLooking;
  }
  return personas;
}

void VSALinuxPersonaService::forgetTrust() {
  std::lock_guard lock(cacheMutex_);
  ++changesHeard_;
  trustedUntil_ = {};
}

std::optional<std::vector<VSAPersonaAttributes>> VSALinuxPersonaService::readPersonas() {
  VSAErrorRef error;
  auto bytes = VSAReadFile(personasPath(), &error);
  if (!bytes) {
    if (error && error->domain() == kVSAPOSIXErrorDomain && error->code() == ENOENT) {
      VSAPersonaAttributes personal;
      personal.personaID = kVSADefaultPersonalPersonaID;
      personal.uniqueString = kVSADefaultPersonalPersonaString;
      return std::vector<VSAPersonaAttributes>{personal};
    }
    VSALog(kVSALogError, "VSALinuxPersonaService", "Cannot read %s: %@", personasPath(), error);
    return std::nullopt;
  }
  auto value = VSAPlist::parse(*bytes, &error);
  const VSAValue* list = value ? (value->isArray() ? &*value : value->get("Personas")) : nullptr;
  if (!list || !list->isArray()) {
    VSALog(kVSALogError, "VSALinuxPersonaService", "%s is not a list of personas", personasPath());
    return std::nullopt;
  }
  std::vector<VSAPersonaAttributes> out;
  for (const VSAValue& record : *list->arrayValue())
    if (auto a = parseRecord(record, root_)) out.push_back(std::move(*a));
  return out;
}

std::string VSALinuxPersonaService::processRecordPath(pid_t pid) const {
  return VSAProcessRecords(root_).path(VSAProcessRecordKind::Persona, pid);
}

std::optional<uint32_t> VSALinuxPersonaService::recordedPersonaID(pid_t pid,
                                                                  uint64_t startTime) const {
  auto value = VSAProcessRecords(root_).readForProcessOrAncestor(VSAProcessRecordKind::Persona, pid,
                                                                 startTime);
  if (!value || value->find_first_not_of("0123456789") != std::string::npos || value->size() > 10)
    return std::nullopt;
  unsigned long long persona = std::strtoull(value->c_str(), nullptr, 10);
  if (persona > UINT32_MAX) return std::nullopt;
  return static_cast<uint32_t>(persona);
}

std::optional<VSAPersonaAttributes> VSALinuxPersonaService::currentPersona() {
  auto served = VSACurrentPersonaScope::current();
  if (!served) return std::nullopt;
  auto personas = listPersonas();
  if (!personas) return std::nullopt;
  auto read = [&] { return recordedPersonaID(served->first, served->second); };
  VSAPersonaRecordMemo* memo = VSACurrentPersonaScope::currentMemo();
  auto recorded = memo ? memo->get(read) : read();
  for (const VSAPersonaAttributes& a : *personas) {
    if (recorded ? a.personaID == *recorded : a.isPersonal()) return a;
  }
  return std::nullopt;
}

void VSALinuxPersonaService::registerObserver(const std::string& serviceName,
                                              std::function<void()> onChange,
                                              std::function<void(VSAErrorRef)> completion) {
  // The kept list is let go before the observer hears of the change, so that
  // what it reads in answer is the new file.
  auto watcher = std::make_unique<VSAInotifyWatcher>(
      root_.resolve("/etc/vessad"), std::set<std::string>{"personas.plist"},
      VSAWorkQueue::create(serviceName),
      [this, onChange = std::move(onChange)](const std::string&) {
        forgetTrust();
        onChange();
      });
  VSAErrorRef error;
  bool ok = watcher->start(&error);
  if (ok) {
    std::lock_guard lock(watcherMutex_);
    watcher_ = std::move(watcher);
    // The file may have changed before the watch began: look once more.
    std::lock_guard cacheLock(cacheMutex_);
    watched_ = true;
    trustedUntil_ = {};
  }
  VSAWorkQueue::global()->async(
      [completion = std::move(completion), error, ok] { completion(ok ? nullptr : error); });
}
