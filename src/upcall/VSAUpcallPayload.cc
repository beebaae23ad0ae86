#include "upcall/VSAUpcallPayload.h"

#include <cstring>

#include "upcall/VSAPackBuffer.h"
#include "upcall/VSAUpcallServer.h"

std::optional<std::vector<uint8_t>> VSAUpcallProcess::pack() const {
  sb_packbuff* b = sb_packbuff_new(0);
  if (!b) return std::nullopt;
  int e = 0;
  auto str = [&](uint16_t type, const std::optional<std::string>& s) {
    if (!e && s) e = sb_packbuff_pack_string(b, type, s->c_str(), s->size());
  };
  auto num = [&](uint16_t type, const std::optional<uint32_t>& v) {
    if (!e && v) e = sb_packbuff_pack_uint32(b, type, *v);
  };
  str(VS_KERN_REQUEST_CODE_SIGNATURE_ID, codeSignatureID);
  str(VS_KERN_REQUEST_CONTAINER_ID, containerID);
  str(VS_KERN_REQUEST_APPLICATION_ID, applicationID);
  num(VS_KERN_REQUEST_UID, uid);
  for (const auto& g : groups) str(VS_KERN_REQUEST_APP_GROUP_ID, g);
  num(VS_KERN_REQUEST_CONTAINER_TYPE, sandboxType);
  str(VS_KERN_REQUEST_SYSTEM_CONTAINER_ID, systemContainerID);
  for (const auto& g : systemGroups) str(VS_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID, g);
  num(VS_KERN_REQUEST_PERSONA_ID, personaID);
  std::optional<std::vector<uint8_t>> out;
  if (!e) {
    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(b));
    out.emplace(bytes, bytes + sb_packbuff_get_size(b));
  }
  sb_packbuff_free(b);
  return out;
}

VSAUpcallAnswer VSAUpcallAnswer::read(const std::vector<uint8_t>& bytes) {
  VSAUpcallAnswer a;
  std::vector<uint64_t> aligned(bytes.size() / 8 + 1, 0);
  if (!bytes.empty()) std::memcpy(aligned.data(), bytes.data(), bytes.size());
  sb_packbuff* b =
      sb_packbuff_init_with_buffer(aligned.data(), bytes.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  if (!b) {
    a.malformed = true;
    return a;
  }
  uint16_t type = 0;
  while (!a.malformed && sb_packbuff_get_item_value_type(b, &type)) {
    int e = 0;
    size_t length = 0;
    if (type == VS_KERN_REPLY_SUCCESS) {
      a.success = sb_packbuff_unpack_uint32(b, &e);
      // The flag is the last item: what follows it may lie past the storage.
      if (e == ERANGE) e = 0;
      if (e) a.malformed = true;
      break;
    }
    if (type == VS_KERN_REPLY_GROUP_ID || type == VS_KERN_REPLY_SYSTEM_GROUP_ID) {
      const char *key = nullptr, *value = nullptr;
      uint16_t valueType = 0;
      e = sb_packbuff_unpack_key_with_string_value(b, &key, &valueType, &value, &length);
      if (e) {
        a.malformed = true;
        break;
      }
      (type == VS_KERN_REPLY_GROUP_ID ? a.groups : a.systemGroups).emplace_back(key, value);
      continue;
    }
    const char* text = sb_packbuff_unpack_string(b, &length, &e);
    if (e || !text) {
      a.malformed = true;
      break;
    }
    std::string s(text, length);
    switch (type) {
      case VS_KERN_REPLY_HOME_DIR_PATH:
        a.home = s;
        break;
      case VS_KERN_REPLY_DATA_CONTAINER_PATH:
        a.dataContainer = s;
        break;
      case VS_KERN_REPLY_TEMP_DIR_PATH:
        a.temporaryDirectory = s;
        break;
      case VS_KERN_REPLY_SYSTEM_CONTAINER_PATH:
        a.systemContainer = s;
        break;
      default:
        a.malformed = true;
    }
  }
  sb_packbuff_free(b);
  return a;
}
