// A fresh directory under /tmp for one test, removed with everything in it
// when the test ends.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

// Gives the system root `root` a "mobile" user (501) and its home, which
// user identities need.
inline void VSAWriteMobileUser(const std::string& root) {
  std::filesystem::create_directories(root + "/etc");
  std::filesystem::create_directories(root + "/private/var/mobile");
  std::ofstream(root + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
}

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
