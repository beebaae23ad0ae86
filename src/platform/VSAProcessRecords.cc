#include "platform/VSAProcessRecords.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
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

int VSAProcessRecords::openDirectory(VSAProcessRecordKind kind, VSAUniqueFd* out) const {
  struct open_how how {};
  how.flags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
  how.resolve = RESOLVE_NO_SYMLINKS;
  auto open = [&] {
    out->reset(static_cast<int>(
        ::syscall(SYS_openat2, AT_FDCWD, directory(kind).c_str(), &how, sizeof how)));
    return *out ? 0 : errno;
  };
  // The directory is made by the first launch after a boot; every later
  // launch opens it at once.
  int e = open();
  if (e != ENOENT) return e;
  if ((e = VSAMakeDirectories(directory(kind), 0755))) return e;
  return open();
}

namespace {
// Appends the decimal digits of `n` at `out`; returns the end.
char* appendNumber(char* out, uint64_t n) {
  char digits[20];
  int count = 0;
  do digits[count++] = static_cast<char>('0' + n % 10);
  while ((n /= 10) != 0);
  while (count > 0) *out++ = digits[--count];
  return out;
}
}  // namespace

int VSAProcessRecords::writeAt(int directory, pid_t pid, uint64_t startTime, const char* value) {
  char name[24], temporary[40], text[kVSAMaxRecordSize + 1];
  *appendNumber(name, static_cast<uint64_t>(pid)) = '\0';
  char* end = appendNumber(temporary, static_cast<uint64_t>(pid));
  const char suffix[] = ".recording";
  for (char c : suffix) *end++ = c;  // the terminating NUL included
  end = appendNumber(text, startTime);
  *end++ = ' ';
  for (size_t i = 0; value[i]; ++i) {
    if (i >= kVSAMaxRecordedValue) return EINVAL;
    *end++ = value[i];
  }
  *end++ = '\n';
  int fd =
      ::openat(directory, temporary, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644);
  if (fd < 0) return errno;
  size_t length = static_cast<size_t>(end - text);
  int e = 0;
  if (::fchmod(fd, 0644) != 0) e = errno;  // whatever the umask
  if (!e && ::write(fd, text, length) != static_cast<ssize_t>(length)) e = errno ? errno : EIO;
  if (::close(fd) != 0 && !e) e = errno;
  if (!e && ::renameat(directory, temporary, directory, name) != 0) e = errno;
  if (e) ::unlinkat(directory, temporary, 0);
  return e;
}

int VSAProcessRecords::write(VSAProcessRecordKind kind, pid_t pid, uint64_t startTime,
                             const std::string& value) const {
  if (!isRecordableValue(value)) return EINVAL;
  VSAUniqueFd directory;
  if (int e = openDirectory(kind, &directory)) return e;
  return writeAt(directory.get(), pid, startTime, value.c_str());
}

int VSAOwnProcessRecord::prepare(const VSAProcessRecords& records, VSAProcessRecordKind kind,
                                 const std::string& value) {
  if (!VSAProcessRecords::isRecordableValue(value)) return EINVAL;
  value_ = value;
  return records.openDirectory(kind, &directory_);
}

int VSAOwnProcessRecord::writeForSelf() const {
  if (!directory_) return EBADF;
  pid_t self = ::getpid();
  uint64_t startTime = VSAAuditToken::processStartTime(self);
  if (!startTime) return ESRCH;
  return VSAProcessRecords::writeAt(directory_.get(), self, startTime, value_.c_str());
}

void VSAOwnProcessRecord::removeForUnreapedChild(pid_t child) const {
  if (directory_) ::unlinkat(directory_.get(), std::to_string(child).c_str(), 0);
}

void VSAProcessRecords::remove(VSAProcessRecordKind kind, pid_t pid, uint64_t startTime) const {
  if (read(kind, pid, startTime)) ::unlink(path(kind, pid).c_str());
}
