// vessa-upcall: the kernel's side of the upcall, for people and tests. It
// builds the request the sandbox would send for a launching process, sends
// it to vessad's upcall socket and prints the containers of the reply.
// vessad serves it only when it is registered as the kernel bridge
// ("KernelBridge" in its client-registry entry).
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "base/VSAJSON.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSAUpcallClient.h"
#include "upcall/VSAUpcallMessage.h"
#include "upcall/VSAUpcallPayload.h"

namespace {
void usage(FILE* out) {
  std::fprintf(
      out,
      "usage: vessa-upcall [--root DIR | --socket PATH] [options]\n"
      "\n"
      "Asks vessad, as the kernel does when it starts a sandboxed process, which\n"
      "containers the process gets, and prints them.\n"
      "\n"
      "  --signing-id ID        code-signing identifier of the process\n"
      "  --container-id ID      data container identifier (wins over --signing-id)\n"
      "  --app-id ID            application identifier\n"
      "  --uid N                user id of the process\n"
      "  --persona N            persona id of the process\n"
      "  --plugin               the process is a plug-in (sandbox type 1; default 0, an app)\n"
      "  --group ID             an application group (repeatable)\n"
      "  --system-container ID  its system container\n"
      "  --system-group ID      a system group container (repeatable)\n"
      "  --message-id N         message id (default 322514900)\n"
      "  --json                 print the reply as JSON\n"
      "\n"
      "Exit status: 0 when every container was produced (return code 0, success\n"
      "flag 1), 1 otherwise, 2 for usage or connection errors.\n");
}

uint32_t number(const char* text) {
  char* end = nullptr;
  unsigned long v = std::strtoul(text, &end, 10);
  if (!*text || *end || v > UINT32_MAX) {
    std::fprintf(stderr, "vessa-upcall: not a number: %s\n", text);
    std::exit(2);
  }
  return static_cast<uint32_t>(v);
}

void print(const VSAUpcallReply& reply, const VSAUpcallAnswer& a, bool json) {
  if (json) {
    VSAValue v = VSAValue::dictionary();
    v.set("ReturnCode", VSAValue(static_cast<int64_t>(reply.returnCode)));
    if (a.home) v.set("Home", *a.home);
    if (a.dataContainer) v.set("DataContainer", *a.dataContainer);
    if (a.temporaryDirectory) v.set("TemporaryDirectory", *a.temporaryDirectory);
    if (a.systemContainer) v.set("SystemContainer", *a.systemContainer);
    VSAValue groups = VSAValue::dictionary(), systemGroups = VSAValue::dictionary();
    for (const auto& [id, path] : a.groups) groups.set(id, path);
    for (const auto& [id, path] : a.systemGroups) systemGroups.set(id, path);
    v.set("Groups", groups);
    v.set("SystemGroups", systemGroups);
    if (a.success) v.set("Success", VSAValue(static_cast<uint64_t>(*a.success)));
    std::printf("%s\n", VSAJSON::print(v, true).c_str());
    return;
  }
  std::printf("return code: %d\n", reply.returnCode);
  if (a.home) std::printf("home:             %s\n", a.home->c_str());
  if (a.dataContainer) std::printf("data container:   %s\n", a.dataContainer->c_str());
  if (a.temporaryDirectory) std::printf("temporary dir:    %s\n", a.temporaryDirectory->c_str());
  for (const auto& [id, path] : a.groups) std::printf("group %s: %s\n", id.c_str(), path.c_str());
  if (a.systemContainer) std::printf("system container: %s\n", a.systemContainer->c_str());
  for (const auto& [id, path] : a.systemGroups)
    std::printf("system group %s: %s\n", id.c_str(), path.c_str());
  if (a.success) std::printf("success:          %u\n", *a.success);
  if (a.malformed) std::printf("(the reply buffer is malformed)\n");
}
}  // namespace

int main(int argc, char** argv) {
  std::string root = "/", socketPath;
  bool json = false;
  uint32_t messageID = kVSAUpcallGetProcessContainersID;
  VSAUpcallProcess process;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    auto next = [&]() -> const char* {
      if (i + 1 >= argc) {
        std::fprintf(stderr, "vessa-upcall: %s needs a value\n", a.c_str());
        std::exit(2);
      }
      return argv[++i];
    };
    if (a == "--root")
      root = next();
    else if (a == "--socket")
      socketPath = next();
    else if (a == "--signing-id")
      process.codeSignatureID = next();
    else if (a == "--container-id")
      process.containerID = next();
    else if (a == "--app-id")
      process.applicationID = next();
    else if (a == "--uid")
      process.uid = number(next());
    else if (a == "--persona")
      process.personaID = number(next());
    else if (a == "--plugin")
      process.sandboxType = 1;
    else if (a == "--group")
      process.groups.push_back(next());
    else if (a == "--system-container")
      process.systemContainerID = next();
    else if (a == "--system-group")
      process.systemGroups.push_back(next());
    else if (a == "--message-id")
      messageID = number(next());
    else if (a == "--json")
      json = true;
    else if (a == "-h" || a == "--help")
      return usage(stdout), 0;
    else {
      std::fprintf(stderr, "vessa-upcall: unknown argument %s\n", a.c_str());
      usage(stderr);
      return 2;
    }
  }
  if (!process.sandboxType) process.sandboxType = 0u;  // an app unless told otherwise
  if (socketPath.empty()) socketPath = VSASystemRoot(root).upcallSocketPath();
  auto memory = process.pack();
  if (!memory) {
    std::fprintf(stderr, "vessa-upcall: the request does not fit a pack buffer\n");
    return 2;
  }
  VSAUpcallRequest request;
  request.id = messageID;
  request.descriptorSize = request.requestSize = static_cast<uint32_t>(memory->size());
  VSAUpcallClient client;
  std::string why;
  std::vector<uint8_t> replyBytes;
  std::optional<std::vector<uint8_t>> replyMemory;
  if (!client.connect(socketPath, &why) ||
      !client.call(request.bytes(), &*memory, &replyBytes, &replyMemory, &why)) {
    std::fprintf(stderr, "vessa-upcall: %s\n", why.c_str());
    return 2;
  }
  auto reply = VSAUpcallReply::parse(replyBytes.data(), replyBytes.size());
  if (!reply) {
    std::fprintf(stderr, "vessa-upcall: a reply of %zu bytes is not an upcall reply\n",
                 replyBytes.size());
    return 2;
  }
  VSAUpcallAnswer answer;
  if (replyMemory) answer = VSAUpcallAnswer::read(*replyMemory);
  print(*reply, answer, json);
  return reply->returnCode == 0 && answer.success == 1u && !answer.malformed ? 0 : 1;
}
