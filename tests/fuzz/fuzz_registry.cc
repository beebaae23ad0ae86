// Fuzzes the client registry: the input is one entry file of
// etc/vessad/clients.d. A malformed entry gives no identity; an entry that
// is taken names a registered executable below the root and a dictionary of
// entitlements.
#include "VSAFuzzDevice.h"
#include "platform/VSAClientRegistry.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static VSAFuzzDevice device("registry");
  static VSAClientRegistry registry{VSASystemRoot(device.root)};
  static const bool made = [] {
    std::filesystem::create_directories(device.root + "/usr/bin");
    std::ofstream(device.root + "/usr/bin/client") << "#!/bin/sh\n";
    std::filesystem::create_directories(registry.directory());
    return true;
  }();
  (void)made;
  VSAFuzzDevice::put(registry.directory() + "/entry.plist", data, size);
  for (const auto& entry : registry.entriesForSigningIdentifier("com.example.client")) {
    if (entry.signingIdentifier != "com.example.client" || !entry.entitlements.isDictionary())
      __builtin_trap();
  }
  (void)registry.entryForExecutable(device.root + "/usr/bin/client");
  return 0;
}
