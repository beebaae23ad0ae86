#include "platform/VSAClientRegistry.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstdlib>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "platform/VSAProcessRecords.h"
#include "platform/VSAUserDatabase.h"

VSAClientRegistry::VSAClientRegistry(VSASystemRoot root) : root_(std::move(root)) {}

namespace {
std::string canonical(const std::string& path) {
  char buf[PATH_MAX];
  return realpath(path.c_str(), buf) ? std::string(buf) : std::string();
}

// Writable by someone other than root: a non-root owner can always make it
// writable, and group or other write bits open it to more users.
bool writableByOthers(const struct stat& st) {
  return st.st_uid != 0 || (st.st_mode & (S_IWGRP | S_IWOTH)) != 0;
}
}  // namespace

bool VSAClientRegistry::executableIsRootControlled(const std::string& hostPath,
                                                   const std::string& origin) {
  struct stat st;
  const char* why = nullptr;
  std::string dir = hostPath.substr(0, hostPath.find_last_of('/'));
  if (dir.empty()) dir = "/";
  if (stat(hostPath.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
    why = "the executable is not a regular file";
  } else if (writableByOthers(st)) {
    why = "the executable is writable by users other than root";
  } else if (stat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode) || writableByOthers(st)) {
    why = "the executable's directory is writable by users other than root";
  }
  if (!why) return true;
  VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAClientRegistry",
           "Ignoring client registry entry %s for %s: %s", origin, hostPath, why);
  return false;
}

std::optional<VSAClientRegistryEntry> VSAClientRegistry::loadEntry(const std::string& file) {
  struct stat st;
  if (lstat(file.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return std::nullopt;
  if (st.st_uid != 0 || (st.st_mode & (S_IWGRP | S_IWOTH))) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAClientRegistry",
             "Ignoring client registry entry %s: not owned by root or writable by others", file);
    return std::nullopt;
  }
  VSAErrorRef error;
  auto dict = VSA_dictionaryWithContentsOfURL(file, 0, &error);
  auto bad = [&](const char* why) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAClientRegistry",
             "Ignoring client registry entry %s: %s", file, why);
    return std::nullopt;
  };
  if (!dict) return bad(error ? error->localizedDescription().c_str() : "unreadable");
  const VSAValue* exe = dict->get("Executable");
  const VSAValue* sid = dict->get("SigningIdentifier");
  const VSAValue* ent = dict->get("Entitlements");
  if (!exe || !exe->isString() || exe->stringValue()->empty() || exe->stringValue()->front() != '/')
    return bad("\"Executable\" must be an absolute path");
  if (!sid || !sid->isString() || sid->stringValue()->empty())
    return bad("\"SigningIdentifier\" must be a string");
  if (ent && !ent->isDictionary()) return bad("\"Entitlements\" must be a dictionary");
  for (const char* key : {"Sandboxed", "KernelBridge"}) {
    const VSAValue* v = dict->get(key);
    if (v && !v->isBool()) return bad("\"Sandboxed\" and \"KernelBridge\" must be booleans");
  }
  VSAClientRegistryEntry entry;
  if (const VSAValue* user = dict->get("User")) {
    if (user->isInteger()) {
      auto uid = user->uint64Value();
      if (!uid || *uid > UINT32_MAX - 1) return bad("\"User\" is not a valid uid");
      entry.user = static_cast<uid_t>(*uid);
    } else if (user->isString()) {
      auto account = VSAUserDatabase(root_).userNamed(*user->stringValue());
      if (!account) return bad("\"User\" names no user of the device");
      entry.user = account->uid;
    } else {
      return bad("\"User\" must be a uid or a user name");
    }
  }
  entry.rootPath = root_.resolve(*exe->stringValue());
  entry.executable = canonical(entry.rootPath);
  if (entry.executable.empty()) return bad("the executable does not exist");
  if (!executableIsRootControlled(entry.executable, file)) return std::nullopt;
  entry.signingIdentifier = *sid->stringValue();
  if (ent) entry.entitlements = *ent;
  if (auto v = dict->get("Sandboxed")) entry.sandboxed = *v->boolValue();
  if (auto v = dict->get("KernelBridge")) entry.kernelBridge = *v->boolValue();
  return entry;
}

void VSAClientRegistry::reloadIfChanged() {
  std::string dir = directory();
  struct stat st;
  struct timespec mtime = {0, 0};
  if (stat(dir.c_str(), &st) == 0) mtime = st.st_mtim;
  if (mtime.tv_sec == loadedMTime_.tv_sec && mtime.tv_nsec == loadedMTime_.tv_nsec) return;
  loadedMTime_ = mtime;
  byExecutable_.clear();
  DIR* d = opendir(dir.c_str());
  if (!d) return;
  while (struct dirent* e = readdir(d)) {
    std::string name = e->d_name;
    if (name.size() < 7 || name.compare(name.size() - 6, 6, ".plist") != 0 || name[0] == '.')
      continue;
    if (auto entry = loadEntry(VSAPathJoin(dir, name))) {
      auto [it, inserted] = byExecutable_.emplace(entry->executable, *entry);
      if (!inserted)
        VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAClientRegistry",
                 "Duplicate client registry entry for %s in %s ignored", entry->executable, name);
    }
  }
  closedir(d);
}

std::optional<VSAClientRegistryEntry> VSAClientRegistry::entryForExecutable(
    const std::string& hostPath) {
  std::lock_guard lock(mutex_);
  reloadIfChanged();
  auto it = byExecutable_.find(hostPath);
  if (it == byExecutable_.end()) return std::nullopt;
  return it->second;
}

std::vector<VSAClientRegistryEntry> VSAClientRegistry::entriesForSigningIdentifier(
    const std::string& signingIdentifier) {
  std::lock_guard lock(mutex_);
  reloadIfChanged();
  std::vector<VSAClientRegistryEntry> entries;
  for (const auto& [path, entry] : byExecutable_)
    if (entry.signingIdentifier == signingIdentifier) entries.push_back(entry);
  return entries;
}

std::optional<VSAClientRegistryEntry> VSAClientRegistry::entryForAuditToken(
    const VSAAuditToken& token) {
  // The kernel answers this link with the executable's resolved absolute path
  // (one system call, where realpath would walk every component again). A
  // deleted executable reads as "<path> (deleted)" and matches no entry.
  char path[64];
  std::snprintf(path, sizeof path, "/proc/%d/exe", token.pid);
  char buf[PATH_MAX];
  ssize_t n = readlink(path, buf, sizeof buf);
  std::string exe = n > 0 && n < static_cast<ssize_t>(sizeof buf) ? std::string(buf, n) : "";
  // Check after resolving the path, so the path surely belongs to this process.
  if (exe.empty() || !token.isCurrent()) return std::nullopt;
  return entryForPeer(token, exe);
}

std::optional<VSAClientRegistryEntry> VSAClientRegistry::entryForPeer(
    const VSAAuditToken& token, const std::string& executable) {
  // Only a peer that is not root can be a launched app: the launcher's child
  // records itself while still root and connects only once it is the app.
  std::optional<std::string> launched;
  if (token.uid != 0)
    launched = VSAProcessRecords(root_).readForProcessOrAncestor(
        VSAProcessRecordKind::SigningIdentifier, token.pid, token.startTime);
  if (launched) {
    VSAClientRegistryEntry entry;
    entry.executable = executable;
    entry.signingIdentifier = *launched;
    entry.sandboxed = true;
    entry.user = token.uid;
    entry.launched = true;
    return entry;
  }
  auto entry = entryForExecutable(executable);
  if (!entry) return std::nullopt;
  if (entry->user != token.uid) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAClientRegistry",
             "Peer %@ runs %s as uid %u, but its registry entry requires uid %u: no identity",
             token, executable, token.uid, entry->user);
    return std::nullopt;
  }
  // The files may have changed hands since the entry was loaded.
  if (!executableIsRootControlled(entry->executable, entry->signingIdentifier)) return std::nullopt;
  return entry;
}
