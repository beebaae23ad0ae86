#include "base/VSALogFile.h"

#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/spdlog.h>

#include "base/VSALog.h"

namespace {
constexpr size_t kVSALogFileKept = 3;
constexpr const char* kVSALogFilePattern = "%Y-%m-%d %H:%M:%S.%e %v";

std::shared_ptr<spdlog::sinks::rotating_file_sink_mt> makeSink(const std::string& path,
                                                               size_t sizeLimit) {
  return std::make_shared<spdlog::sinks::rotating_file_sink_mt>(path, sizeLimit, kVSALogFileKept);
}

class VSASpdlogFile : public VSALogFile {
 public:
  VSASpdlogFile(std::string path, std::shared_ptr<spdlog::sinks::rotating_file_sink_mt> sink)
      : path_(std::move(path)), logger_("com.tamsk.vessad", std::move(sink)) {
    logger_.set_pattern(kVSALogFilePattern);
    logger_.set_level(spdlog::level::trace);
    logger_.flush_on(spdlog::level::trace);
  }

  void writeLine(const std::string& line) override { logger_.info("{}", line); }
  void flush() override { logger_.flush(); }
  void setSizeLimit(size_t sizeLimit) override {
    try {
      logger_.sinks().front() = makeSink(path_, sizeLimit);
      logger_.set_pattern(kVSALogFilePattern);
    } catch (const std::exception&) {
      // The file stays as it was opened.
    }
  }

 private:
  std::string path_;
  spdlog::logger logger_;
};
}  // namespace

std::unique_ptr<VSALogFile> VSALogFile::open(const std::string& path, size_t sizeLimit) {
  try {
    return std::make_unique<VSASpdlogFile>(path, makeSink(path, sizeLimit));
  } catch (const std::exception&) {
    return nullptr;
  }
}

// Defined here rather than beside the rest of the logger: a program that
// never opens the file never links the file writer.
bool VSALogger::openRotatingLog(const std::string& path, int writerLevel) {
  auto file = VSALogFile::open(path, 102400);
  if (!file) return false;
  {
    std::lock_guard lock(mutex_);
    file_ = std::move(file);
  }
  if (writerLevel > level()) setLevel(writerLevel);
  return true;
}
