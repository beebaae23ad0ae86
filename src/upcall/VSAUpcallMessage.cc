#include "upcall/VSAUpcallMessage.h"

#include <cstring>

namespace {
uint32_t read32(const uint8_t* bytes, size_t length, size_t offset) {
  uint32_t v = 0;
  if (offset + 4 <= length) std::memcpy(&v, bytes + offset, 4);
  return v;
}
void write32(std::vector<uint8_t>& out, size_t offset, uint32_t v) {
  std::memcpy(out.data() + offset, &v, 4);
}
// The NDR record every message carries: integers little-endian, ASCII, IEEE floats.
constexpr uint8_t kNDR[8] = {0, 0, 0, 0, 1, 0, 0, 0};
}  // namespace

VSAUpcallRequest VSAUpcallRequest::parse(const uint8_t* bytes, size_t length) {
  VSAUpcallRequest r;
  r.messageLength = length;
  r.bits = read32(bytes, length, 0);
  r.size = read32(bytes, length, 4);
  r.replyPort = read32(bytes, length, 8);
  r.id = read32(bytes, length, 20);
  r.descriptorCount = read32(bytes, length, 24);
  r.descriptorType = length > 39 ? bytes[39] : 0;
  r.descriptorSize = read32(bytes, length, 40);
  r.requestSize = read32(bytes, length, 52);
  return r;
}

std::vector<uint8_t> VSAUpcallRequest::bytes() const {
  std::vector<uint8_t> out(kVSAUpcallRequestSize, 0);
  write32(out, 0, bits);
  write32(out, 4, size);
  write32(out, 8, replyPort);
  write32(out, 20, id);
  write32(out, 24, descriptorCount);
  out[39] = descriptorType;
  write32(out, 40, descriptorSize);
  std::memcpy(out.data() + 44, kNDR, sizeof kNDR);
  write32(out, 52, requestSize);
  return out;
}

int32_t VSAUpcallRequest::validate(uint64_t memorySize) const {
  if (!(bits & kVSAUpcallComplexBit) || messageLength != kVSAUpcallRequestSize ||
      size != kVSAUpcallRequestSize || descriptorCount != 1 || descriptorType != 1 ||
      requestSize != descriptorSize || descriptorSize != memorySize)
    return kVSAUpcallTypeError;
  if (trailerType != 0 || trailerSize < kVSAUpcallTrailerSize) return kVSAUpcallTrailerError;
  return kVSAUpcallSuccess;
}

uint32_t VSAUpcallRequest::senderPID() const {
  // The audit token's sixth word is the process id (see VSAAuditToken::bytes).
  uint32_t pid = 0;
  std::memcpy(&pid, auditToken.data() + 20, 4);
  return pid;
}

VSAUpcallReply VSAUpcallReply::forRequest(const VSAUpcallRequest& request, int32_t returnCode) {
  VSAUpcallReply reply;
  reply.id = request.id + kVSAUpcallReplyIDOffset;
  reply.remotePort = request.replyPort;
  reply.returnCode = returnCode;
  return reply;
}

std::vector<uint8_t> VSAUpcallReply::bytes() const {
  bool served = returnCode == kVSAUpcallSuccess;
  std::vector<uint8_t> out(served ? kVSAUpcallServedReplySize : kVSAUpcallErrorReplySize, 0);
  write32(out, 0, served ? kVSAUpcallComplexBit : 0);
  write32(out, 4, static_cast<uint32_t>(out.size()));
  write32(out, 8, remotePort);
  write32(out, 20, id);
  if (served) {
    write32(out, 24, 1);
    out[39] = 1;
    write32(out, 40, replySize);
    std::memcpy(out.data() + 44, kNDR, sizeof kNDR);
    write32(out, 52, replySize);
  } else {
    std::memcpy(out.data() + 24, kNDR, sizeof kNDR);
    write32(out, 32, static_cast<uint32_t>(returnCode));
  }
  return out;
}

std::optional<VSAUpcallReply> VSAUpcallReply::parse(const uint8_t* bytes, size_t length) {
  if (length != kVSAUpcallServedReplySize && length != kVSAUpcallErrorReplySize)
    return std::nullopt;
  VSAUpcallReply reply;
  reply.remotePort = read32(bytes, length, 8);
  reply.id = read32(bytes, length, 20);
  if (length == kVSAUpcallServedReplySize) {
    if (!(read32(bytes, length, 0) & kVSAUpcallComplexBit)) return std::nullopt;
    reply.returnCode = kVSAUpcallSuccess;
    reply.replySize = read32(bytes, length, 52);
  } else {
    reply.returnCode = static_cast<int32_t>(read32(bytes, length, 32));
  }
  return reply;
}
