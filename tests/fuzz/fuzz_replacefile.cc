// Fuzzes the replace-file reader: whatever the file holds, it is refused
// with code 35 or gives four clean absolute paths, which write back and
// read again to the same four.
#include "VSAFuzzDevice.h"
#include "base/VSAPathString.h"
#include "operations/VSAReplaceFile.h"

namespace {
// Absolute, more than "/", no NUL, no ".." component ("/p" is fine).
bool clean(const std::string& path) {
  if (path.size() < 2 || path[0] != '/' || path.find('\0') != std::string::npos) return false;
  return path.find("/../") == std::string::npos && path != "/.." && !path.ends_with("/..");
}
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static VSAFuzzDevice device("replace");
  static const std::string file = device.config->replaceDirectory() + "/journal.plist";
  VSAFuzzDevice::put(file, data, size);
  VSAErrorRef error;
  auto info = VSAReplaceFile::_readAndValidateReplaceFileAtUrl(*device.fileManager, file, &error);
  if (!info) {
    if (!error || error->resultCode(0) != 35) __builtin_trap();
    return 0;
  }
  for (const auto* p : {&info->oldURL, &info->newURL, &info->stagingURL, &info->destURL})
    if (!clean(*p)) __builtin_trap();
  if (!VSAReplaceFile::_writeToDiskReplaceAt(*device.fileManager, file, info->oldURL, info->newURL,
                                             info->stagingURL, info->destURL, &error))
    __builtin_trap();
  auto again = VSAReplaceFile::_readAndValidateReplaceFileAtUrl(*device.fileManager, file, &error);
  if (!again || again->oldURL != info->oldURL || again->newURL != info->newURL ||
      again->stagingURL != info->stagingURL || again->destURL != info->destURL)
    __builtin_trap();
  return 0;
}
