#include "platform/VSAProcessRecords.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "base/VSAPlist.h"

namespace {
// The longest value a record holds, and so the largest record read:
// 20 digits of start time, a space, the value and a newline.
constexpr size_t kVSAMaxRecordedValue = 255;
constexpr size_t kVSAMaxRecordSize = 20 + 1 + kVSAMaxRecordedValue + 1;
// How far up a process's ancestors a record is looked for.
constexpr int kVSAMaxGenerations = 16;

const char* subdirectory(VSAProcessRecordKind kind) {
  return kind == VSAProcessRecordKind::Persona ? "/run/vessad/process-personas"
                                               : "/run/vessad/process-signing-identifiers";
}
}  // namespace

std::string VSAProcessRecords::directory(VSAProcessRecordKind kind) const {
  return root_.resolve(subdirectory(kind));
}

std::string VSAProcessRecords::path(VSAProcessRecordKind kind, pid_t pid) const {
  return directory(kind) + "/" + std::to_string(pid);
}

bool VSAProcessRecords::isRecordableValue(const std::string& value) {
  if (value.empty() || value.size() > kVSAMaxRecordedValue) return false;
  for (unsigned char c : value)
    if (c <= ' ' || c == 0x7f) return false;
  return true;
}

std::optional<std::string> VSAProcessRecords::read(VSAProcessRecordKind kind, pid_t pid,
                                                   uint64_t startTime) const {
  std::vector<uint8_t> bytes;
  struct stat st;
  if (VSAReadRegularFile(path(kind, pid), kVSAMaxRecordSize, &bytes, &st) != 0 || st.st_uid != 0)
    return std::nullopt;
  std::string text(bytes.begin(), bytes.end());
  if (!text.empty() && text.back() == '\n') text.pop_back();
  size_t space = text.find(' ');
  if (space == std::string::npos || space == 0 || space > 20) return std::nullopt;
  for (size_t i = 0; i < space; ++i)
    if (text[i] < '0' || text[i] > '9') return std::nullopt;
  unsigned long long recorded = std::strtoull(text.c_str(), nullptr, 10);
  std::string value = text.substr(space + 1);
  if (recorded != startTime || !isRecordableValue(value)) return std::nullopt;
  return value;
}

std::optional<std::string> VSAProcessRecords::readForProcessOrAncestor(VSAProcessRecordKind kind,
                                                                       pid_t pid,
                                                                       uint64_t startTime) const {
  if (auto value = read(kind, pid, startTime)) return value;
  auto self = VSAAuditToken::processStat(pid, true);
  if (!self || self->startTime != startTime || self->uid == 0) return std::nullopt;
  const uid_t uid = self->uid;
  for (int generation = 0; generation < kVSAMaxGenerations; ++generation) {
    pid_t parentPID = self->parent;
    auto parent = parentPID > 1 ? VSAAuditToken::processStat(parentPID, true) : std::nullopt;
    if (!parent || parent->uid != uid) return std::nullopt;
    auto value = read(kind, parentPID, parent->startTime);
    // Still the parent: the start time read above was the parent's own.
    auto again = VSAAuditToken::processStat(pid, false);
    if (!again || again->startTime != startTime || again->parent != parentPID) return std::nullopt;
    if (value) return value;
    pid = parentPID;
    startTime = parent->startTime;
    self = parent;
  }
  return std::nullopt;
}

int VSAProcessRecords::write(VSAProcessRecordKind kind, pid_t pid, uint64_t startTime,
                             const std::string& value) const {
  if (!isRecordableValue(value)) return EINVAL;
  if (int e = VSAMakeDirectories(directory(kind), 0755)) return e;
  std::string text = std::to_string(startTime) + " " + value + "\n";
  VSAErrorRef error;
  // The records live in /run: they need not outlive a power loss, only be whole.
  if (!VSAWriteFileAtomically(path(kind, pid), std::vector<uint8_t>(text.begin(), text.end()), 0644,
                              &error, false))
    return error && error->domain() == kVSAPOSIXErrorDomain ? static_cast<int>(error->code()) : EIO;
  return 0;
}

void VSAProcessRecords::remove(VSAProcessRecordKind kind, pid_t pid, uint64_t startTime) const {
  if (read(kind, pid, startTime)) ::unlink(path(kind, pid).c_str());
}
