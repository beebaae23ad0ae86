// Fuzzes the metadata-file reader: the input is the content of a container's
// metadata file (an app owns the container, so it can write anything there).
// The bounded read and the binary-only decoder take it, then every
// validation step; whatever validates must write back and read again to the
// same identity.
#include "VSAFuzzDevice.h"
#include "base/VSAPlist.h"
#include "model/VSAMetadata.h"

namespace {
// A data container of the personal user, named by a UUID as on a device.
struct Device : VSAFuzzDevice {
  std::string container, file;
  Device() : VSAFuzzDevice("metadata") {
    container =
        *config->containerDirectoryURLForUserIdentity(personal, VSAClass::kDataApplication, false) +
        "/0A1B2C3D-0000-4000-8000-00000000F00D";
    std::filesystem::create_directories(container);
    file = container + "/" + kVSAMetadataFileName;
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
  if (!VSAContainerClassIsValid(m->containerClass()) || m->url() != device.container)
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
