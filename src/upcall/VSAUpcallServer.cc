#include "upcall/VSAUpcallServer.h"

#include <cerrno>
#include <cstring>
#include <map>

#include "base/VSALog.h"
#include "base/VSAValue.h"
#include "upcall/VSAPackBuffer.h"

namespace {
const char* const kOrigin = "server_get_process_containers";

template <typename... A>
void logUpcall(int level, const char* format, const A&... args) {
  VSALogIn(VSALogCategory::Upcall, level, kOrigin, format, args...);
}

const char* itemName(uint16_t valueType) {
  static const char* const names[] = {
      "VS_KERN_REQUEST_CODE_SIGNATURE_ID", "VS_KERN_REQUEST_CONTAINER_ID",
      "VS_KERN_REQUEST_APPLICATION_ID",    "VS_KERN_REQUEST_UID",
      "VS_KERN_REQUEST_APP_GROUP_ID",      "VS_KERN_REQUEST_CONTAINER_TYPE",
      "VS_KERN_REQUEST_CONTAINER_ID",      "VS_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID",
      "VS_KERN_REQUEST_PERSONA_ID"};
  return valueType < 9 ? names[valueType] : "<unknown>";
}

// What the kernel asked for.
struct ProcessRequest {
  std::optional<std::string> codeSignatureID, containerID, applicationID, systemContainerID;
  uint32_t uid = 0, sandboxType = 0, personaID = 0;
  std::vector<std::string> groups, systemGroups;
};

// Reads every request item; 0 or the return code that ends the request.
int32_t readRequest(sb_packbuff* in, ProcessRequest* r) {
  uint16_t type = 0;
  while (sb_packbuff_get_item_value_type(in, &type)) {
    if (type > VS_KERN_REQUEST_PERSONA_ID) {
      logUpcall(kVSALogError, "unexpected value: %u", type);
      return kVSAUpcallInvalidArgument;
    }
    int error = 0;
    if (type == VS_KERN_REQUEST_UID || type == VS_KERN_REQUEST_CONTAINER_TYPE ||
        type == VS_KERN_REQUEST_PERSONA_ID) {
      uint32_t v = sb_packbuff_unpack_uint32(in, &error);
      if (error) {
        logUpcall(kVSALogError,
                  type == VS_KERN_REQUEST_UID
                      ? "failed: to unpack uint32 for VS_KERN_REQUEST_UID. error: %d"
                  : type == VS_KERN_REQUEST_CONTAINER_TYPE
                      ? "failed: to unpack uint32 for VS_KERN_REQUEST_CONTAINER_TYPE. error: %d"
                      : "failed: to unpack uint32 for VS_KERN_REQUEST_PERSONA_ID. error: %d",
                  error);
        return kVSAUpcallFailure;
      }
      (type == VS_KERN_REQUEST_UID              ? r->uid
       : type == VS_KERN_REQUEST_CONTAINER_TYPE ? r->sandboxType
                                                : r->personaID) = v;
      continue;
    }
    size_t length = 0;
    const char* text = sb_packbuff_unpack_string(in, &length, &error);
    if (error || !text) {
      logUpcall(kVSALogError, "failed: to unpack string for %s. error: %d\n", itemName(type),
                error);
      return kVSAUpcallFailure;
    }
    std::string value(text, length);
    switch (type) {
      case VS_KERN_REQUEST_CODE_SIGNATURE_ID:
        r->codeSignatureID = value;
        break;
      case VS_KERN_REQUEST_CONTAINER_ID:
        r->containerID = value;
        break;
      case VS_KERN_REQUEST_APPLICATION_ID:
        r->applicationID = value;
        break;
      case VS_KERN_REQUEST_APP_GROUP_ID:
        r->groups.push_back(value);
        break;
      case VS_KERN_REQUEST_SYSTEM_CONTAINER_ID:
        r->systemContainerID = value;
        break;
      default:
        r->systemGroups.push_back(value);
        break;
    }
    // Each one may make a container: one launch must not ask for thousands.
    if (r->groups.size() > kVSAUpcallMaxGroupItems ||
        r->systemGroups.size() > kVSAUpcallMaxGroupItems) {
      logUpcall(kVSALogError, "Too many items of type %s in one upcall (at most %zu)",
                itemName(type), kVSAUpcallMaxGroupItems);
      return kVSAUpcallInvalidArgument;
    }
  }
  return kVSAUpcallSuccess;
}

// Identifier -> path, as the debug lines show a set of containers.
VSAValue pathsByIdentifier(const std::vector<std::pair<std::string, std::string>>& paths) {
  VSAValue::Dictionary d;
  for (const auto& [id, path] : paths) d[id] = VSAValue(path);
  return VSAValue(std::move(d));
}

// The data classes and the app group: every per-user class.
bool isDataClass(VSAContainerClass c) { return VSAContainerClassIsPerUser(c); }

// One upcall's containers, made and packed.
struct ContainerRun {
  const VSAUpcallEnvironment& env;
  const ProcessRequest& request;
  VSAUserIdentityRef user;
  bool success = true;
  std::optional<std::string> dataContainer{}, systemContainer{};
  std::vector<std::pair<std::string, std::string>> groupPaths{}, systemGroupPaths{};

  // `failure`: the line logged with the result code when the container cannot be had.
  std::optional<std::string> make(const std::string& id, VSAContainerClass c, const char* failure) {
    uint64_t code = 1;
    auto path = env.createOrLookup(user, id, c, &code);
    if (!path) {
      logUpcall(kVSALogError, failure, static_cast<unsigned long long>(code));
      success = false;
    }
    return path;
  }

  void checkUID(VSAContainerClass c) {
    uid_t expected = user->posixUIDForContainerClass(c);
    if (request.uid != expected)
      logUpcall(kVSALogError, "Invalid UID from kernel: %u, expected: %u", request.uid, expected);
  }

  VSAContainerClass dataClass(const std::string& id) {
    VSAContainerClass c = env.dataContainerTypeForIdentifier(id);
    if (isDataClass(c)) {
      if (request.sandboxType == 1 && c != VSAClass::kDataPlugin) {
        logUpcall(kVSALogNotice, "SB Type: %u, FX Type: %llu.  Declaring this a plugin",
                  request.sandboxType, static_cast<unsigned long long>(c));
        return VSAClass::kDataPlugin;
      }
      if (request.sandboxType == 0 && c != VSAClass::kDataApplication)
        logUpcall(kVSALogNotice, "SB type is app, but FX type is %llu",
                  static_cast<unsigned long long>(c));
      return c;
    }
    logUpcall(kVSALogError, "Invalid data container class for %@: %llu", id,
              static_cast<unsigned long long>(c));
    VSAContainerClass fallback =
        request.sandboxType == 1 ? VSAClass::kDataPlugin : VSAClass::kDataApplication;
    logUpcall(kVSALogNotice, "SB Type: %u, falling back to class: %llu", request.sandboxType,
              static_cast<unsigned long long>(fallback));
    return fallback;
  }

  void makeAll() {
    const auto& id = request.containerID ? request.containerID : request.codeSignatureID;
    if (id) {
      VSAContainerClass c = dataClass(*id);
      checkUID(c);
      dataContainer = make(*id, c, "createOrLookupContainerForUser: Failed with error: %llu");
    }
    if (request.systemContainerID)
      systemContainer =
          make(*request.systemContainerID, VSAClass::kSystemData,
               "createOrLookupContainerForUser:(system container) Failed with error: %llu");
    if (!request.groups.empty()) checkUID(VSAClass::kAppGroup);
    for (const auto& g : request.groups)
      if (auto path = make(g, VSAClass::kAppGroup,
                           "createOrLookupGroupContainersForUser: Failed with error: %llu"))
        groupPaths.emplace_back(g, *path);
    for (const auto& g : request.systemGroups)
      if (auto path = make(
              g, VSAClass::kSystemGroup,
              "createOrLookupContainerForUser:(system group container) Failed with error: %llu"))
        systemGroupPaths.emplace_back(g, *path);
  }

  void pack(sb_packbuff* out, uint16_t type, const std::string& path) {
    if (!success) return;
    if (int e = sb_packbuff_pack_string(out, type, path.c_str(), path.size())) {
      logUpcall(kVSALogError, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n", e, type,
                path);
      success = false;
    }
  }
  void packPair(sb_packbuff* out, uint16_t keyType, uint16_t valueType,
                const std::pair<std::string, std::string>& pair) {
    if (!success) return;
    if (int e = sb_packbuff_pack_key_with_string_value(out, keyType, pair.first.c_str(), valueType,
                                                       pair.second.c_str())) {
      logUpcall(kVSALogError,
                "sb_packbuff_pack_key_with_string_value() fails: %d; type: %u, key: %s, value: "
                "%s\n",
                e, keyType, pair.first, pair.second);
      success = false;
    }
  }

  void packReply(sb_packbuff* out) {
    std::string home;
    if (success) {
      home = request.uid == 0 ? env.rootHomeDirectory : user->homeDirectoryURL();
      logUpcall(kVSALogDebug, "UPCALL-Containers for %@(%u):", request.codeSignatureID.value_or(""),
                request.uid);
      logUpcall(kVSALogDebug, "dataContainerURL: %@", dataContainer.value_or("(null)"));
      logUpcall(kVSALogDebug, "tempContainerURL: %@",
                dataContainer ? *dataContainer + "/tmp" : std::string("(null)"));
      logUpcall(kVSALogDebug, "homeDirURL: %@", home);
      logUpcall(kVSALogDebug, "groupURLs: %@", pathsByIdentifier(groupPaths));
      logUpcall(kVSALogDebug, "systemContainerURL: %@", systemContainer.value_or("(null)"));
      logUpcall(kVSALogDebug, "systemGroupURLs: %@", pathsByIdentifier(systemGroupPaths));
    }
    pack(out, VS_KERN_REPLY_HOME_DIR_PATH, home);
    if (dataContainer) {
      pack(out, VS_KERN_REPLY_DATA_CONTAINER_PATH, *dataContainer);
      pack(out, VS_KERN_REPLY_TEMP_DIR_PATH, *dataContainer + "/tmp");
    }
    for (const auto& g : groupPaths)
      packPair(out, VS_KERN_REPLY_GROUP_ID, VS_KERN_REPLY_GROUP_PATH, g);
    if (systemContainer) pack(out, VS_KERN_REPLY_SYSTEM_CONTAINER_PATH, *systemContainer);
    for (const auto& g : systemGroupPaths)
      packPair(out, VS_KERN_REPLY_SYSTEM_GROUP_ID, VS_KERN_REPLY_SYSTEM_GROUP_PATH, g);
    uint32_t flag = success ? 1 : 0;
    if (int e = sb_packbuff_pack_uint32(out, VS_KERN_REPLY_SUCCESS, flag))
      logUpcall(kVSALogError, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n", e,
                VS_KERN_REPLY_SUCCESS, flag);
  }
};

VSAUserIdentityRef userIdentityFor(const VSAUpcallEnvironment& env, const ProcessRequest& r,
                                   int32_t* code) {
  *code = kVSAUpcallInvalidArgument;
  auto& cache = *env.userIdentityCache;
  VSAUserIdentityRef user;
  if (env.isMultiUser && env.isMultiUser()) {
    user = cache.userIdentityForPersonalPersonaWithUID(r.uid, r.uid);
  } else {
    auto personas = env.personaService->listPersonas();
    const VSAPersonaAttributes* found = nullptr;
    if (personas)
      for (const auto& p : *personas)
        if (p.personaID == r.personaID) found = &p;
    if (!found) {
      logUpcall(kVSALogFault, "%s: Could not look up info for persona id %u", kOrigin, r.personaID);
      return nullptr;
    }
    // The personal persona and the device's default (universal) one both
    // mean the personal user identity.
    user = found->isPersonal() || found->isUniversal()
               ? cache.userIdentityForPersonalPersona()
               : cache.userIdentityWithPersonaID(r.personaID);
  }
  if (!user)
    logUpcall(kVSALogFault, "%s: Unable to find user identity for persona id %u", kOrigin,
              r.personaID);
  return user;
}
}  // namespace

VSAUpcallServer::Outcome VSAUpcallServer::demux_server(const VSAUpcallRequest& request,
                                                       const uint8_t* memory, size_t memorySize) {
  VSALogIn(VSALogCategory::Upcall, kVSALogDebug, "demux_server",
           "in demux_server(); request->msgh_id: %d", static_cast<int>(request.id));
  Outcome outcome;
  int32_t code = kVSAUpcallBadID;
  if ((request.id >> 1) == (kVSAUpcallGetProcessContainersID >> 1)) {
    VSALogIn(VSALogCategory::Upcall, kVSALogDebug, "demux_server",
             "handling incomming request for vessa_core server");
    if (request.id == kVSAUpcallGetProcessContainersID) {
      code = server_get_process_containers(request, memory, memorySize, &outcome.buffer,
                                           &outcome.memory);
      outcome.handled = true;
    }
  }
  outcome.reply = VSAUpcallReply::forRequest(request, code);
  outcome.reply.replySize = static_cast<uint32_t>(outcome.buffer.size());
  VSALogIn(VSALogCategory::Upcall, kVSALogDebug, "demux_server", "vessa_core server returns: %d",
           code);
  return outcome;
}

int32_t VSAUpcallServer::server_get_process_containers(const VSAUpcallRequest& request,
                                                       const uint8_t* memory, size_t memorySize,
                                                       std::vector<uint8_t>* replyBuffer,
                                                       VSAUniqueFd* replyMemory) {
  if (int32_t invalid = request.validate(memorySize)) return invalid;
  if (memorySize > kVSAUpcallMaxRequestSize) return kVSAUpcallTypeError;
  if (request.senderPID() != 0) {
    logUpcall(kVSALogError, "Refusing an upcall from a sender that is not the kernel (pid %u)",
              request.senderPID());
    return kVSAUpcallFailure;
  }
  VSASignpostInterval signpost(VSALogCategory::Upcall, "KernelUpcall");
  // The items are read in place, so the copy is 8-byte aligned.
  std::vector<uint64_t> aligned((memorySize + 7) / 8 + 1, 0);
  if (memorySize) std::memcpy(aligned.data(), memory, memorySize);
  sb_packbuff* in =
      sb_packbuff_init_with_buffer(aligned.data(), memorySize, true, SB_PACKBUFF_DEALLOC_NONE);
  if (!in) {
    logUpcall(kVSALogError, "sb_packbuff_init() of request data fails");
    return kVSAUpcallNoMemory;
  }
  ProcessRequest r;
  int32_t code = readRequest(in, &r);
  sb_packbuff_free(in);
  if (code) return code;
  sb_packbuff* out = sb_packbuff_new(4096);
  if (!out) return kVSAUpcallNoMemory;
  VSAUserIdentityRef user = userIdentityFor(environment_, r, &code);
  if (!user) {
    sb_packbuff_free(out);
    return code;
  }
  ContainerRun run{environment_, r, user};
  run.makeAll();
  run.packReply(out);
  const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(out));
  replyBuffer->assign(bytes, bytes + sb_packbuff_get_size(out));
  if (environment_.copyReplyMemory) {
    // The kernel takes over a copy of the reply; without one it is told
    // that no reply memory came (a descriptor of size 0).
    errno = 0;
    *replyMemory = environment_.copyReplyMemory(*replyBuffer);
    int copyError = errno;
    if (*replyMemory) {
      logUpcall(kVSALogDebug, "packbuff bytes: %p, reply bytes: %p, reply size: %u",
                static_cast<const void*>(bytes), static_cast<const void*>(replyBuffer->data()),
                static_cast<unsigned>(replyBuffer->size()));
    } else {
      logUpcall(kVSALogError, "vm_read(%p, %lu) fails: %d", static_cast<const void*>(bytes),
                static_cast<unsigned long>(replyBuffer->size()), copyError);
      replyBuffer->clear();
    }
  }
  sb_packbuff_free(out);
  return kVSAUpcallSuccess;
}
