// The upcall server: answers the kernel's question "which containers does
// this launching process get?" with the paths of its data container, its
// temporary directory, its home directory, its group containers, its system
// container and its system group containers, creating those that do not
// exist yet. Request and answer are pack buffers (VSAPackBuffer.h).
//
// demux_server serves one message: only id 322514900 is served, any other
// is answered with -303. server_get_process_containers validates the
// message (-300, -309), serves only the kernel (else 5), reads the request
// items (an unknown one is 4, an unreadable one 5), finds the user identity
// (an unknown persona is 4) and makes the containers through the
// environment's create-or-look-up, which acts as a privileged kernel client.
// A container that cannot be made does not fail the upcall: the reply
// carries the items packed before it and a final success flag of 0.
//
// Runs on the upcall queue, which targets the listener queue, so upcalls
// never overlap client requests. Not thread-safe by itself.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "model/VSAContainerClass.h"
#include "model/VSAUserIdentityCache.h"
#include "platform/VSAPersonaService.h"
#include "platform/VSAUniqueFd.h"
#include "upcall/VSAUpcallMessage.h"

// Request item value types.
enum : uint16_t {
  VS_KERN_REQUEST_CODE_SIGNATURE_ID = 0,
  VS_KERN_REQUEST_CONTAINER_ID = 1,
  VS_KERN_REQUEST_APPLICATION_ID = 2,
  VS_KERN_REQUEST_UID = 3,
  VS_KERN_REQUEST_APP_GROUP_ID = 4,
  VS_KERN_REQUEST_CONTAINER_TYPE = 5,
  VS_KERN_REQUEST_SYSTEM_CONTAINER_ID = 6,
  VS_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID = 7,
  VS_KERN_REQUEST_PERSONA_ID = 8,
};

// Reply item value types, in the order they are packed.
enum : uint16_t {
  VS_KERN_REPLY_SUCCESS = 0,
  VS_KERN_REPLY_DATA_CONTAINER_PATH = 1,
  VS_KERN_REPLY_TEMP_DIR_PATH = 2,
  VS_KERN_REPLY_GROUP_ID = 3,
  VS_KERN_REPLY_GROUP_PATH = 4,
  VS_KERN_REPLY_HOME_DIR_PATH = 100,
  VS_KERN_REPLY_SYSTEM_CONTAINER_PATH = 101,
  VS_KERN_REPLY_SYSTEM_GROUP_ID = 102,
  VS_KERN_REPLY_SYSTEM_GROUP_PATH = 103,
};

// Requests larger than this are refused as malformed (-300): a real one
// names a handful of identifiers.
inline constexpr uint64_t kVSAUpcallMaxRequestSize = 1u << 20;
// Group and system-group identifiers one request may name, each list.
inline constexpr size_t kVSAUpcallMaxGroupItems = 128;

struct VSAUpcallEnvironment {
  std::shared_ptr<VSAUserIdentityCache> userIdentityCache;
  std::shared_ptr<VSAPersonaService> personaService;
  std::function<bool()> isMultiUser;
  // The home directory answered for uid 0 ("/private/var/root" on the device).
  std::string rootHomeDirectory = "/private/var/root";
  // The data container class an identifier's code signing asks for.
  std::function<VSAContainerClass(const std::string& identifier)> dataContainerTypeForIdentifier;
  // Creates or looks up a container as the kernel: its path, or nothing
  // with the result code in `code`.
  std::function<std::optional<std::string>(const VSAUserIdentityRef& user,
                                           const std::string& identifier,
                                           VSAContainerClass containerClass, uint64_t* code)>
      createOrLookup;
  // Copies the reply pack buffer into the memory the kernel takes over (a
  // sealed memfd); an invalid descriptor, with errno set, when it cannot.
  // Unset: the reply goes without memory of its own.
  std::function<VSAUniqueFd(const std::vector<uint8_t>& bytes)> copyReplyMemory;
};

class VSAUpcallServer {
 public:
  explicit VSAUpcallServer(VSAUpcallEnvironment environment)
      : environment_(std::move(environment)) {}

  struct Outcome {
    VSAUpcallReply reply;
    std::vector<uint8_t> buffer;  // the reply pack buffer's bytes (served replies)
    VSAUniqueFd memory;           // their copy for the kernel, when one was made
    bool handled = false;
  };
  // `memory` is the request pack buffer as received (any bytes).
  Outcome demux_server(const VSAUpcallRequest& request, const uint8_t* memory, size_t memorySize);
  int32_t server_get_process_containers(const VSAUpcallRequest& request, const uint8_t* memory,
                                        size_t memorySize, std::vector<uint8_t>* replyBuffer,
                                        VSAUniqueFd* replyMemory);

 private:
  VSAUpcallEnvironment environment_;
};
