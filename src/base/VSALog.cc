#include "base/VSALog.h"

#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <ctime>

#include "base/VSALogFile.h"
#include "base/VSASystemdLibrary.h"

std::atomic<int> gVSALogWriterLevel{kVSALogNotice};

VSALogger& VSALogger::shared() {
  static auto* logger = new VSALogger();  // leaked: used until the very end
  return *logger;
}

VSALogger::VSALogger() {
  struct stat st;
  journald_ = stat("/run/systemd/journal/socket", &st) == 0 && S_ISSOCK(st.st_mode);
}

const char* VSALogger::subsystemName(VSALogCategory category) {
  return category == VSALogCategory::Daemon ? "com.tamsk.vessad" : "com.tamsk.vessacore";
}

const char* VSALogger::categoryName(VSALogCategory category) {
  switch (category) {
    case VSALogCategory::Unspecified:
      return "unspecified";
    case VSALogCategory::Cache:
      return "cache";
    case VSALogCategory::Sandbox:
      return "sandbox";
    case VSALogCategory::Relay:
      return "relay";
    case VSALogCategory::Locking:
      return "locking";
    case VSALogCategory::Database:
      return "database";
    case VSALogCategory::Upcall:
      return "upcall";
    case VSALogCategory::Lifecycle:
      return "lifecycle";
    case VSALogCategory::FS:
      return "fs";
    case VSALogCategory::Startup:
      return "startup";
    case VSALogCategory::Test:
      return "test";
    case VSALogCategory::Metadata:
      return "metadata";
    case VSALogCategory::CodeSignMapping:
      return "codesignmapping";
    case VSALogCategory::Daemon:
      return "daemon";
  }
  return "unspecified";
}

void VSALogger::enableDiskLogging(int diskLevel, size_t sizeLimit) {
  std::lock_guard lock(mutex_);
  if (!file_) return;
  file_->setSizeLimit(sizeLimit);
  diskEnabled_ = true;
  diskMaxLevel_ = diskLevel >= 4 ? kVSALogDebug : kVSALogNotice;
}

void VSALogger::closeRotatingLog() {
  std::lock_guard lock(mutex_);
  if (file_) file_->flush();
  file_.reset();
  diskEnabled_ = false;
}

void VSALogger::flush() {
  std::lock_guard lock(mutex_);
  if (file_) file_->flush();
  std::fflush(stderr);
}

namespace {
const char* levelName(int level) {
  switch (level) {
    case kVSALogFault:
      return "Fault";
    case kVSALogError:
      return "Error";
    case kVSALogNotice:
      return "Notice";
    case kVSALogInfo:
      return "Info";
    default:
      return "Debug";
  }
}
}  // namespace

void VSALogger::writeUnified(VSALogCategory category, int level, const char* origin,
                             const std::string& m) {
  const VSASystemdLibrary* systemd =
      journald_ && !forceStderr_ ? VSASystemdLibrary::get() : nullptr;
  if (systemd) {
    systemd->journalSend("MESSAGE=%s: %s", origin, m.c_str(), "PRIORITY=%d", level < 0 ? 0 : level,
                         "SYSLOG_IDENTIFIER=vessad", "VESSA_SUBSYSTEM=%s", subsystemName(category),
                         "VESSA_CATEGORY=%s", categoryName(category), "CODE_FUNC=%s", origin,
                         nullptr);
    return;
  }
  auto now = std::chrono::system_clock::now();
  std::time_t t = std::chrono::system_clock::to_time_t(now);
  std::tm tm;
  localtime_r(&t, &tm);
  char stamp[32];
  std::strftime(stamp, sizeof stamp, "%H:%M:%S", &tm);
  std::fprintf(stderr, "%s vessad[%d] %s [%s:%s] %s: %s\n", stamp, getpid(), levelName(level),
               subsystemName(category), categoryName(category), origin, m.c_str());
}

void VSALogger::write(VSALogCategory category, int level, const char* origin,
                      const std::string& message) {
  writeUnified(category, level, origin, message);
  std::lock_guard lock(mutex_);
  if (file_ && diskEnabled_ && level <= diskMaxLevel_) {
    file_->writeLine(VSAFormat("%d [%s] <%s> %s: %s", getpid(), categoryName(category),
                               levelName(level), origin, message));
  }
}

namespace {
std::atomic<uint64_t> gSignpostIds{1};
}

uint64_t VSASignpostBegin(VSALogCategory category, const char* name, const std::string& text) {
  uint64_t id = gSignpostIds.fetch_add(1);
  VSALogIn(category, kVSALogDebug, "signpost", "begin %s [%llu]%s", name, id, text);
  return id;
}

void VSASignpostEnd(VSALogCategory category, const char* name, uint64_t id,
                    const std::string& text) {
  VSALogIn(category, kVSALogDebug, "signpost", "end %s [%llu]%s", name, id, text);
}
