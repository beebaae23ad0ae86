// Fuzzes the metadata-file reader: the input is the content of a container's
// metadata file (an app owns the container, so it can write anything there).
// The bounded read and the binary-only decoder take it, then every
// validation step; whatever validates must write back and read again to the
// same identity.
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "base/VSALog.h"
#include "base/VSAPlist.h"
#include "model/FakePersonaService.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAMetadata.h"
#include "model/VSAUserIdentityCache.h"
#include "platform/VSALinuxFileSystem.h"

namespace {
struct Device {
  std::string root, container, file;
  std::shared_ptr<VSAGlobalConfiguration> config;
  std::shared_ptr<VSAUserIdentityCache> identities;
  VSAUserIdentityRef personal;

  Device() {
    VSALogger::shared().setLevel(0);  // every refusal is logged; that only slows the run
    char tmpl[] = "/tmp/vessa-fuzz-metadata-XXXXXX";
    root = mkdtemp(tmpl);
    std::filesystem::create_directories(root + "/etc");
    std::filesystem::create_directories(root + "/private/var/mobile");
    std::ofstream(root + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    VSASystemRoot systemRoot(root);
    auto users = std::make_shared<VSAUserDatabase>(systemRoot);
    config = std::make_shared<VSAGlobalConfiguration>(
        systemRoot, std::make_shared<VSADeviceProperties>(systemRoot), users,
        std::make_shared<VSAFileManager>(std::make_shared<VSALinuxFileSystem>(), users));
    auto personas = std::make_shared<FakePersonaService>();
    personas->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(VSAPersonaAttributes::Kind::Personal, 1000, "P", {})};
    identities = VSAUserIdentityCache::create({personas, users, 501, 501, true, nullptr});
    personal = identities->userIdentityForPersonalPersona();
    // A data container of the personal user, named by a UUID as on a device.
    container = *config->containerDirectoryURLForUserIdentity(personal, 2, false) +
                "/0A1B2C3D-0000-4000-8000-00000000F00D";
    std::filesystem::create_directories(container);
    file = container + "/" + kVSAMetadataFileName;
  }
  ~Device() {
    std::error_code ec;
    std::filesystem::remove_all(root, ec);
  }
};
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Device device;
  {
    std::ofstream out(device.file, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
  }
  VSAErrorRef error;
  auto m = VSAMetadata::readAndValidateMetadataAtUrl(device.container, device.personal, true,
                                                     *device.config, *device.identities, &error);
  if (!m) {
    // Every refusal carries one of the reader's two codes.
    VSAResultCode code = error ? error->resultCode(0) : 0;
    if (code != VSAResult::kMetadataUnreadable && code != VSAResult::kInvalidUpdateFile)
      __builtin_trap();
    return 0;
  }
  // Accepted: only a binary list within the size limit can have been.
  if (size > kVSAMetadataFileMaxSize || !VSABinaryPlist::isBinaryPlist(data, size))
    __builtin_trap();
  if (m->containerClass() < 1 || m->containerClass() > 13 || m->url() != device.container)
    __builtin_trap();
  // Written back and read again, it names the same container.
  if (!m->writeMetadataToDiskWithError(*device.config, &error)) __builtin_trap();
  auto again = VSAMetadata::readAndValidateMetadataAtUrl(
      device.container, device.personal, true, *device.config, *device.identities, &error);
  if (!again || again->identifier() != m->identifier() || again->uuid() != m->uuid() ||
      again->containerClass() != m->containerClass())
    __builtin_trap();
  return 0;
}
