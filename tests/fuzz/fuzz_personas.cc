// Fuzzes the persona list file etc/vessad/personas.plist: whatever it holds,
// the service answers a list (or nothing for a file it cannot parse), and
// the list it answers for a file does not change while the file does not.
#include "VSAFuzzDevice.h"
#include "platform/VSALinuxPersonaService.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static VSAFuzzDevice device("personas");
  static VSALinuxPersonaService service{VSASystemRoot(device.root)};
  VSAFuzzDevice::put(service.personasPath(), data, size);
  auto personas = service.listPersonas();
  auto again = service.listPersonas();
  if (personas.has_value() != again.has_value()) __builtin_trap();
  if (personas && personas->size() != again->size()) __builtin_trap();
  (void)service.currentPersona();
  return 0;
}
