// Logging: the rotating "vessad.log" on disk and the unified log.
//
// VSALog(level, origin, format, args...) takes the daemon's texts as they
// stand (printf style, "%@" for objects; see VSAFormat.h). Levels follow the
// syslog numbers: 3 error, 5 notice, 6 info, 7 debug; 2 is the fault level
// for "must never happen" logic errors (logged, execution continues).
//
// Every line goes to the unified log (journald with VESSA_SUBSYSTEM and
// VESSA_CATEGORY fields, or stderr when journald is absent) while its level is
// within the writer level, and to the rotating file once disk logging is
// enabled: disk level 1 keeps errors and notices, disk level 4 (internal
// builds) keeps everything the writer passes. Signpost intervals are debug
// lines carrying an interval id. VSALogger is thread-safe.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "base/VSAFormat.h"

class VSALogFile;

enum VSALogLevel : int {
  kVSALogFault = 2,
  kVSALogError = 3,
  kVSALogNotice = 5,
  kVSALogInfo = 6,
  kVSALogDebug = 7,
};

enum class VSALogCategory {
  Unspecified,
  Cache,
  Sandbox,
  Relay,
  Locking,
  Database,
  Upcall,
  Lifecycle,
  FS,
  Startup,
  Test,
  Metadata,
  CodeSignMapping,
  Daemon,  // subsystem "com.tamsk.vessad"
};

// The writer level, readable without a call so that disabled lines cost one load.
extern std::atomic<int> gVSALogWriterLevel;

class VSALogger {
 public:
  static VSALogger& shared();

  // Opens (creating) the rotating log file; false when it cannot be opened.
  // (Defined in VSALogFile.cc.)
  bool openRotatingLog(const std::string& path, int writerLevel);
  // Turns on writing to the rotating file with a disk level and size limit.
  void enableDiskLogging(int diskLevel, size_t sizeLimit);
  void closeRotatingLog();
  void flush();

  int level() const { return gVSALogWriterLevel.load(std::memory_order_relaxed); }
  void setLevel(int level) { gVSALogWriterLevel.store(level, std::memory_order_relaxed); }
  static bool enabled(int level) {
    return level <= gVSALogWriterLevel.load(std::memory_order_relaxed);
  }
  // Sends unified-log lines to stderr even when journald is present.
  void setUseStderr(bool useStderr) { forceStderr_ = useStderr; }

  void write(VSALogCategory category, int level, const char* origin, const std::string& message);

  static const char* subsystemName(VSALogCategory category);
  static const char* categoryName(VSALogCategory category);

 private:
  VSALogger();
  void writeUnified(VSALogCategory category, int level, const char* origin, const std::string& m);

  std::mutex mutex_;
  std::unique_ptr<VSALogFile> file_;
  bool diskEnabled_ = false;
  int diskMaxLevel_ = kVSALogNotice;
  bool journald_ = false;
  bool forceStderr_ = false;
};

// Formats and writes a line whose level is on. Kept out of line (and out of
// the hot text) so that a call site of a disabled line is a load, a compare
// and a branch: inlined whole, the formatting's register saves and stack
// frame were paid on every call, enabled or not.
template <typename... A>
[[gnu::noinline, gnu::cold]] void VSALogWrite(VSALogCategory category, int level,
                                              const char* origin, std::string_view format,
                                              const A&... args) {
  VSALogger::shared().write(category, level, origin, VSAFormat(format, args...));
}

template <typename... A>
[[gnu::always_inline]] inline void VSALogIn(VSALogCategory category, int level, const char* origin,
                                            std::string_view format, const A&... args) {
  if (!VSALogger::enabled(level)) [[likely]]
    return;
  VSALogWrite(category, level, origin, format, args...);
}

template <typename... A>
[[gnu::always_inline]] inline void VSALog(int level, const char* origin, std::string_view format,
                                          const A&... args) {
  VSALogIn(VSALogCategory::Unspecified, level, origin, format, args...);
}

// Signpost intervals: begin returns an id that end repeats.
uint64_t VSASignpostBegin(VSALogCategory category, const char* name, const std::string& text = {});
void VSASignpostEnd(VSALogCategory category, const char* name, uint64_t id,
                    const std::string& text = {});

// RAII signpost interval.
class VSASignpostInterval {
 public:
  VSASignpostInterval(VSALogCategory category, const char* name)
      : category_(category), name_(name), id_(VSASignpostBegin(category, name)) {}
  ~VSASignpostInterval() { VSASignpostEnd(category_, name_, id_); }
  VSASignpostInterval(const VSASignpostInterval&) = delete;
  VSASignpostInterval& operator=(const VSASignpostInterval&) = delete;

 private:
  VSALogCategory category_;
  const char* name_;
  uint64_t id_;
};
