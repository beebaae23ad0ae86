// Fuzzes the pending protection update reader: a file is refused with code
// 29 or gives an update of a valid class, which writes back and reads again
// to the same update.
#include "VSAFuzzDevice.h"
#include "dataprotection/VSADataProtectionUpdateFile.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static VSAFuzzDevice device("update");
  static const std::string file = device.config->pendingUpdatesDirectory() + "/update.plist";
  VSAFuzzDevice::put(file, data, size);
  VSAErrorRef error;
  auto update = VSADataProtectionUpdate::_readAndValidateDataProtectionUpdateAtURL(
      file, *device.identities, &error);
  if (!update) {
    if (!error || error->resultCode(0) != 29) __builtin_trap();
    return 0;
  }
  if (size > kVSADataProtectionUpdateFileMaxSize) __builtin_trap();
  if (!VSAWriteDataProtectionUpdate(*update, file, *device.fileManager, kVSANoProtectionClass, 0600,
                                    &error))
    __builtin_trap();
  auto again = VSADataProtectionUpdate::_readAndValidateDataProtectionUpdateAtURL(
      file, *device.identities, &error);
  if (!again || again->identifier != update->identifier ||
      again->containerClass != update->containerClass ||
      again->protectionClass != update->protectionClass || again->internalID != update->internalID)
    __builtin_trap();
  return 0;
}
