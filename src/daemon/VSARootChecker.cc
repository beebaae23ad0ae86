#include "daemon/VSARootChecker.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "base/VSAJSON.h"
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAUUID.h"
#include "codesigning/VSASQLiteDB.h"
#include "daemon/VSADaemonContext.h"
#include "dataprotection/VSADataProtectionUpdateFile.h"
#include "model/VSAMetadata.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSADeathRow.h"
#include "platform/VSAFaultInjectingFileSystem.h"
#include "platform/VSAIPCClient.h"

namespace {
constexpr const char* kNextBoot = "removed by the next boot's cleanup";
constexpr const char* kNextStart = "finished or undone by the next start";
constexpr const char* kAttention = "nothing repairs this: needs attention";

std::string errnoText(int rc) { return std::strerror(rc); }
}  // namespace

VSARootChecker::VSARootChecker(const std::string& rootPath) : rootPath_(rootPath) {}

VSARootChecker::~VSARootChecker() = default;

std::string VSARootChecker::identityKey(const VSAUserIdentityRef& user, VSAContainerClass c,
                                        bool transient, const std::string& identifier) {
  return user->identifier() + "|" + std::to_string(c) + (transient ? "|transient|" : "|live|") +
         identifier;
}

void VSARootChecker::add(const char* kind, const std::string& path, std::string detail,
                         const char* repair) {
  findings_.push_back({kind, path, std::move(detail), repair, repair == kNextStart});
}

VSARootChecker::Status VSARootChecker::check() {
  struct stat st;
  if (::stat(rootPath_.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    unreadable_ = "no system root at " + rootPath_;
    return kUnreadable;
  }
  // A root being served changes under the checker's feet, and its database
  // is the daemon's alone.
  VSAIPCClient probe;
  if (probe.connect(VSASystemRoot(rootPath_).socketPath(), nullptr)) {
    unreadable_ = "a daemon is serving " + rootPath_ + "; stop it first";
    return kUnreadable;
  }
  // Directories the layout would make are refused by the read-only layer,
  // and every refusal would be logged: the report says what matters.
  struct Quiet {
    int saved = VSALogger::shared().level();
    Quiet() { VSALogger::shared().setLevel(kVSALogFault - 1); }
    ~Quiet() { VSALogger::shared().setLevel(saved); }
  } quiet;
  context_ = std::make_unique<VSADaemonContext>(
      VSASystemRoot(rootPath_),
      [](std::shared_ptr<VSAFileSystem> real) {
        return VSAFaultInjectingFileSystem::readOnly(std::move(real));
      },
      false);
  context_->buildModel();
  auto& config = *context_->globalConfiguration;
  auto& users = *context_->userIdentityCache;
  std::set<std::string> stagingDirectories{config.stagingDirectory()};
  users.forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSAUserIdentityRef& u) {
    auto perUser = config.getPerUserConfigurationForUserIdentity(u);
    if (!perUser->existsUserBaseDirectory()) return;
    ++counts_["users"];
    for (VSAContainerClass c : kVSAPerUserContainerClasses) {
      checkClassDirectory(u, c, false);
      checkClassDirectory(u, c, true);
      stagingDirectories.insert(config.stagingDirectoryURLForUserIdentity(u, c));
    }
  });
  for (VSAContainerClass c : kVSAGlobalContainerClasses) {
    checkClassDirectory(users.defaultUserIdentity(), c, false);
    checkClassDirectory(users.defaultUserIdentity(), c, true);
  }
  for (const auto& directory : stagingDirectories)
    checkLeftovers(directory, "staging-leftover", kNextStart);
  checkLeftovers(config.replaceDirectory(), "replace-journal", kNextStart);
  checkPendingUpdates();
  std::vector<VSADirectoryEntry> dead;
  if (context_->fileSystem->readDirectory(config.deathrowDirectory(), &dead) == 0)
    counts_["deathRowEntries"] = dead.size();
  checkTempLeftovers();
  checkDatabase();
  if (!unreadable_.empty()) return kUnreadable;
  return findings_.empty() ? kClean : kFindings;
}

void VSARootChecker::checkClassDirectory(const VSAUserIdentityRef& user, VSAContainerClass c,
                                         bool transient) {
  auto directory =
      context_->globalConfiguration->containerDirectoryURLForUserIdentity(user, c, transient);
  if (!directory) return;
  std::vector<VSADirectoryEntry> entries;
  int rc = context_->fileSystem->readDirectory(*directory, &entries);
  if (rc == ENOENT) return;
  if (rc != 0) {
    add("unreadable", *directory, "cannot list the class directory: " + errnoText(rc), kAttention);
    return;
  }
  for (const auto& entry : entries) checkEntry(user, c, transient, *directory, entry.name);
}

void VSARootChecker::checkEntry(const VSAUserIdentityRef& user, VSAContainerClass c, bool transient,
                                const std::string& directory, const std::string& name) {
  std::string path = VSAPathJoin(directory, name);
  auto& fs = *context_->fileSystem;
  struct stat st;
  bool isDirectory = fs.lstat(path, &st) == 0 && S_ISDIR(st.st_mode);
  if (!isDirectory ||
      !VSAContainerCache::containerURLIsValidForContainerClass(path, c, *context_->whitelist)) {
    ++counts_["orphans"];
    add("orphan", path, "not a container's name or not a directory", kNextBoot);
    return;
  }
  struct stat metadataStat;
  if (fs.lstat(VSAPathJoin(path, kVSAMetadataFileName), &metadataStat) != 0) {
    ++counts_["orphans"];
    add("orphan", path, "no metadata file", kNextBoot);
    return;
  }
  VSAErrorRef error;
  auto metadata = VSAMetadata::readAndValidateMetadataAtUrl(
      path, user, true, *context_->globalConfiguration, *context_->userIdentityCache, &error);
  if (!metadata) {
    add("invalid-metadata", path, error ? error->message() : "unreadable", kAttention);
    return;
  }
  ++counts_["containers"];
  std::string uuid = metadata->uuid().string();
  auto [at, inserted] =
      identities_.emplace(identityKey(user, c, transient, metadata->identifier()), path);
  if (!inserted)
    add("duplicate-identity", path,
        "a second container of " + metadata->identifier() + " (the other: " + at->second + ")",
        kAttention);
  // A wipe works on a transient copy with the live container's UUID; a crash
  // can leave that copy until the next boot, so UUIDs are unique per tree.
  auto [uat, uinserted] = uuids_.emplace((transient ? "transient|" : "live|") + uuid, path);
  if (!uinserted)
    add("duplicate-uuid", path, "UUID " + uuid + " also at " + uat->second, kAttention);
  if (c == VSAClass::kAppGroup && !transient) appGroups_[metadata->identifier()].push_back(path);
  checkOwnership(path, st, user, c);
}

// The top-level directory as creation makes it: bundle containers belong to
// the installer, system containers to root with their ACL, the others to
// their user; all but system containers with mode 0755.
void VSARootChecker::checkOwnership(const std::string& path, const struct stat& st,
                                    const VSAUserIdentityRef& user, VSAContainerClass c) {
  uid_t owner = VSAContainerClassIsBundle(c)   ? CONTAINER_INSTALLATION_UID
                : VSAContainerClassIsSystem(c) ? CONTAINER_SYSTEM_UID
                                               : user->posixUIDForContainerClass(c);
  if (st.st_uid != owner)
    add("owner", path,
        "owned by uid " + std::to_string(st.st_uid) + ", expected " + std::to_string(owner),
        kAttention);
  if (VSAContainerClassIsSystem(c)) {
    std::string acl;
    if (context_->fileSystem->getxattr(path, "system.posix_acl_access", &acl) != 0)
      add("acl", path, "a system container without its access list", kAttention);
  } else if ((st.st_mode & 07777) != 0755) {
    char mode[8];
    std::snprintf(mode, sizeof(mode), "%o", st.st_mode & 07777);
    add("mode", path, std::string("mode ") + mode + ", expected 755", kAttention);
  }
}

void VSARootChecker::checkLeftovers(const std::string& directory, const char* kind,
                                    const char* repair) {
  std::vector<VSADirectoryEntry> entries;
  if (context_->fileSystem->readDirectory(directory, &entries) != 0) return;
  for (const auto& entry : entries)
    add(kind, VSAPathJoin(directory, entry.name), "left by an operation that did not finish",
        repair);
}

// Trees death row could not remove wait in /tmp, where nothing removes
// them: deleted app data that stays, so each one is a finding.
void VSARootChecker::checkTempLeftovers() {
  uint64_t bytes = 0;
  auto leftovers = VSADeathRow::leftoversInTemp(*context_->globalConfiguration);
  for (const auto& leftover : leftovers) {
    bytes += leftover.bytes;
    add("deathrow-leftover", leftover.path,
        "moved aside when death row could not remove it; " + std::to_string(leftover.bytes) +
            " bytes",
        kAttention);
  }
  counts_["tmpLeftovers"] = leftovers.size();
  counts_["tmpLeftoverBytes"] = bytes;
}

void VSARootChecker::checkPendingUpdates() {
  std::string directory = context_->globalConfiguration->pendingUpdatesDirectory();
  std::vector<VSADirectoryEntry> entries;
  if (context_->fileSystem->readDirectory(directory, &entries) != 0) return;
  for (const auto& entry : entries) {
    std::string path = VSAPathJoin(directory, entry.name);
    if (entry.name.rfind(".tmp-", 0) == 0) {
      add("unfinished-write", path, "half-written update file", kNextStart);
      continue;
    }
    VSAErrorRef error;
    auto update = VSADataProtectionUpdate::_readAndValidateDataProtectionUpdateAtURL(
        path, *context_->userIdentityCache, &error);
    if (!update) {
      add("invalid-pending-update", path, error ? error->message() : "unreadable", kAttention);
      continue;
    }
    ++counts_["pendingUpdates"];
    VSAUserIdentityRef user = update->userIdentity
                                  ? update->userIdentity
                                  : context_->userIdentityCache->defaultUserIdentity();
    if (!identities_.count(identityKey(user, update->containerClass, false, update->identifier)))
      add("pending-update-without-container", path,
          "names " + update->identifier + ", which has no live container", kAttention);
  }
}

void VSARootChecker::checkDatabase() {
  std::string directory = context_->globalConfiguration->libraryDirectory();
  struct stat st;
  if (context_->fileSystem->lstat(VSAPathJoin(directory, kVSACodeSigningDatabaseFileName), &st) !=
      0)
    return;
  VSAErrorRef error;
  auto db = VSASQLiteDB::openReadOnly(directory, &error);
  if (!db) {
    unreadable_ = "cannot open the code-signing database: " +
                  (error ? error->message() : std::string("unknown error"));
    return;
  }
  auto integrity = db->integrityCheck(&error);
  if (!integrity) {
    unreadable_ = "cannot check the code-signing database: " + error->message();
    return;
  }
  if (*integrity != "ok") add("database", db->url(), "integrity check: " + *integrity, kAttention);
  std::set<std::string> referenced;
  uint64_t identifiers = 0;
  VSAErrorRef walk = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& id, const VSACodeSigningEntry& entry) {
        ++identifiers;
        const VSAValue* e = entry.codeSigningInfo().get(kVSAEntitlementsKey);
        auto ids = VSACodeSigningMapping::copyApplicationGroupEntitlementForIdentifier(
            id, e, kVSAEntitlementApplicationGroups);
        if (ids) referenced.insert(ids->begin(), ids->end());
      });
  if (walk) {
    add("database", db->url(), "cannot read every row: " + walk->message(), kAttention);
    return;
  }
  counts_["codeSigningIdentifiers"] = identifiers;
  for (const auto& [group, paths] : appGroups_)
    if (!referenced.count(group))
      for (const auto& path : paths)
        notes_.push_back({"unreferenced-group", path, "no identifier's entitlements name " + group,
                          "removed when application groups are next reconciled", false});
}

std::string VSARootChecker::text() const {
  std::string out;
  if (!unreadable_.empty()) out += "cannot check: " + unreadable_ + "\n";
  for (const auto& f : findings_)
    out += f.kind + ": " + f.path + "\n    " + f.detail + " (" + f.repair + ")\n";
  for (const auto& f : notes_)
    out += "note: " + f.kind + ": " + f.path + "\n    " + f.detail + " (" + f.repair + ")\n";
  out += findings_.empty() && unreadable_.empty() ? "clean:" : "findings:";
  out += " " + std::to_string(findings_.size()) + " findings";
  for (const auto& [name, count] : counts_) out += ", " + name + " " + std::to_string(count);
  return out + "\n";
}

std::string VSARootChecker::json() const {
  VSAValue report = VSAValue::dictionary();
  report.set("root", rootPath_);
  report.set("status", findings_.empty() && unreadable_.empty() ? "clean"
                       : unreadable_.empty()                    ? "findings"
                                                                : "unreadable");
  if (!unreadable_.empty()) report.set("unreadable", unreadable_);
  auto list = [](const std::vector<VSARootFinding>& items) {
    VSAValue array = VSAValue::array();
    for (const auto& f : items) {
      VSAValue item = VSAValue::dictionary();
      item.set("kind", f.kind);
      item.set("path", f.path);
      item.set("detail", f.detail);
      item.set("repair", f.repair);
      item.set("repairedAtStart", f.repairedAtStart);
      array.append(std::move(item));
    }
    return array;
  };
  report.set("findings", list(findings_));
  report.set("notes", list(notes_));
  VSAValue counts = VSAValue::dictionary();
  for (const auto& [name, count] : counts_) counts.set(name, static_cast<uint64_t>(count));
  report.set("counts", std::move(counts));
  return VSAJSON::print(report) + "\n";
}
