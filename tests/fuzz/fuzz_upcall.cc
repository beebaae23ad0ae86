// Fuzzes whole upcall messages: the first input byte chooses the sender
// (bit 0: the kernel) and the device mode (bit 1: multi-user), the next 56
// bytes are the message and the rest is the request's out-of-line memory.
// The server parses, validates and answers; containers are "made" by a
// stand-in that only names a path, so that the run exercises the message
// and pack-buffer handling rather than the disk. Every reply must be a well
// formed upcall reply whose buffer reads back.
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "base/VSALog.h"
#include "model/FakePersonaService.h"
#include "model/VSAUserIdentityCache.h"
#include "upcall/VSAUpcallPayload.h"
#include "upcall/VSAUpcallServer.h"

namespace {
struct Device {
  VSAUpcallEnvironment env;
  bool multiUser = false;

  Device() {
    VSALogger::shared().setLevel(0);
    char tmpl[] = "/tmp/vessa-fuzz-upcall-XXXXXX";
    std::string root = mkdtemp(tmpl);
    std::filesystem::create_directories(root + "/etc");
    std::filesystem::create_directories(root + "/private/var/mobile");
    std::ofstream(root + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    auto users = std::make_shared<VSAUserDatabase>(VSASystemRoot(root));
    auto personas = std::make_shared<FakePersonaService>();
    personas->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(VSAPersonaAttributes::Kind::Personal, 1000, "P"),
        FakePersonaService::persona(VSAPersonaAttributes::Kind::Enterprise, 1001, "E")};
    env.personaService = personas;
    env.userIdentityCache =
        VSAUserIdentityCache::create({personas, users, 501, 501, true, nullptr});
    env.isMultiUser = [this] { return multiUser; };
    env.dataContainerTypeForIdentifier = [](const std::string& id) -> VSAContainerClass {
      return id.size() % 15;  // every class, and some that are not data classes
    };
    env.createOrLookup = [](const VSAUserIdentityRef&, const std::string& id, VSAContainerClass c,
                            uint64_t* code) -> std::optional<std::string> {
      if (id.empty() || id[0] == '!') {
        *code = 21;
        return std::nullopt;
      }
      return "/containers/" + std::to_string(c) + "/" + id;
    };
  }
};
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Device device;
  if (size < 1) return 0;
  device.multiUser = data[0] & 2;
  size_t messageLength = std::min<size_t>(size - 1, kVSAUpcallRequestSize);
  VSAUpcallRequest request = VSAUpcallRequest::parse(data + 1, messageLength);
  if (!(data[0] & 1)) request.auditToken[20] = 1;  // a sender that is not the kernel
  const uint8_t* memory = data + 1 + messageLength;
  size_t memorySize = size - 1 - messageLength;
  VSAUpcallServer server(device.env);
  auto outcome = server.demux_server(request, memory, memorySize);
  auto bytes = outcome.reply.bytes();
  auto parsed = VSAUpcallReply::parse(bytes.data(), bytes.size());
  if (!parsed || parsed->returnCode != outcome.reply.returnCode) __builtin_trap();
  if (outcome.reply.returnCode == 0) {
    auto answer = VSAUpcallAnswer::read(outcome.buffer);
    if (answer.malformed || !answer.success) __builtin_trap();
  } else if (!outcome.buffer.empty()) {
    __builtin_trap();
  }
  return 0;
}
