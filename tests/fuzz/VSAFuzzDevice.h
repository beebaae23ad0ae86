// A small device for fuzz targets that read the daemon's own state files: a
// temporary system root with a "mobile" user, its configuration, file
// manager and user identity cache (one personal persona). Logging is off:
// every refusal is logged, which only slows a run. Removed at exit.
#pragma once

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "base/VSALog.h"
#include "model/FakePersonaService.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"
#include "platform/VSALinuxFileSystem.h"

struct VSAFuzzDevice {
  std::string root;
  std::shared_ptr<VSAUserDatabase> users;
  std::shared_ptr<VSAFileManager> fileManager;
  std::shared_ptr<VSAGlobalConfiguration> config;
  std::shared_ptr<VSAUserIdentityCache> identities;
  VSAUserIdentityRef personal;

  explicit VSAFuzzDevice(const char* name) {
    VSALogger::shared().setLevel(0);
    // A memory file system when there is one: every execution writes and
    // renames a file, and a disk's journal would set the pace.
    const char* base = std::filesystem::is_directory("/dev/shm") ? "/dev/shm" : "/tmp";
    std::string tmpl = std::string(base) + "/vessa-fuzz-" + name + "-XXXXXX";
    root = ::mkdtemp(tmpl.data());
    std::filesystem::create_directories(root + "/etc/vessad");
    std::filesystem::create_directories(root + "/private/var/mobile");
    std::ofstream(root + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    VSASystemRoot systemRoot(root);
    users = std::make_shared<VSAUserDatabase>(systemRoot);
    fileManager = std::make_shared<VSAFileManager>(std::make_shared<VSALinuxFileSystem>(), users);
    config = std::make_shared<VSAGlobalConfiguration>(
        systemRoot, std::make_shared<VSADeviceProperties>(systemRoot), users, fileManager);
    auto personas = std::make_shared<FakePersonaService>();
    personas->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(VSAPersonaAttributes::Kind::Personal, 1000, "P", {})};
    identities = VSAUserIdentityCache::create({personas, users, 501, 501, true, nullptr});
    personal = identities->userIdentityForPersonalPersona();
  }
  ~VSAFuzzDevice() {
    std::error_code ec;
    std::filesystem::remove_all(root, ec);
  }
  // Writes `data` to `path` through a temporary name and a rename, as the
  // daemon's writers do (a reader that caches by inode sees a new file).
  static void put(const std::string& path, const uint8_t* data, size_t size) {
    std::string temp = path + ".fuzz-tmp";
    {
      std::ofstream out(temp, std::ios::binary | std::ios::trunc);
      out.write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
    }
    std::filesystem::rename(temp, path);
  }
};
