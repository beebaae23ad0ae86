// The rotating "vessad.log" behind the logger: only the daemon opens one,
// so the file writer (and the library it is built on) is linked only into
// the programs that call VSALogger::openRotatingLog.
#pragma once

#include <cstddef>
#include <memory>
#include <string>

class VSALogFile {
 public:
  virtual ~VSALogFile() = default;
  // Opens (creating) path, rotated at sizeLimit bytes with three old files
  // kept; nullptr when it cannot be opened.
  static std::unique_ptr<VSALogFile> open(const std::string& path, size_t sizeLimit);

  // One line, time-stamped and flushed.
  virtual void writeLine(const std::string& line) = 0;
  virtual void flush() = 0;
  // Keeps writing the same file, rotated at a new size.
  virtual void setSizeLimit(size_t sizeLimit) = 0;
};
