// The daemon's log lines as a test sees them: the process-wide logger is
// pointed at a rotating log file below the test's root, with every level
// written to disk, for as long as the object lives.
#pragma once

#include <fstream>
#include <iterator>
#include <string>

#include "base/VSALog.h"

class VSATestLog {
 public:
  // Opens `path`; false when the logger could not.
  bool open(const std::string& path) {
    path_ = path;
    if (!VSALogger::shared().openRotatingLog(path_, kVSALogDebug)) return false;
    VSALogger::shared().enableDiskLogging(kVSALogDebug, 64u << 20);
    return true;
  }
  ~VSATestLog() {
    if (!path_.empty()) VSALogger::shared().closeRotatingLog();
  }
  std::string text() const {
    VSALogger::shared().flush();
    std::ifstream in(path_);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
  bool contains(const std::string& line) const { return text().find(line) != std::string::npos; }
  // Where `line` first appears; npos when it does not.
  size_t position(const std::string& line) const { return text().find(line); }

 private:
  std::string path_;
};
