// A fresh directory under /tmp for one test, removed with everything in it
// when the test ends.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <string>

class VSATestTempDir {
 public:
  explicit VSATestTempDir(const std::string& prefix = "vessa-test") {
    std::string tmpl = "/tmp/" + prefix + "-XXXXXX";
    path_ = mkdtemp(tmpl.data()) ? tmpl : std::string();
  }
  ~VSATestTempDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
  }
  VSATestTempDir(const VSATestTempDir&) = delete;
  VSATestTempDir& operator=(const VSATestTempDir&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};
