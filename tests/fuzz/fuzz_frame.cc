// Fuzzes what a peer can send: the frame stream and the binary property
// lists inside it, then the re-encoding of whatever decoded.
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "base/VSABinaryPlist.h"
#include "platform/VSAFrameCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // The whole input as one payload.
  std::string why;
  if (auto v = VSAFrameCodec::decodePayload(data, size, &why)) {
    // Whatever decodes must encode, and decode again to the same encoding
    // (compared as bytes, so NaN reals compare equal to themselves).
    auto again = VSABinaryPlist::encode(*v, VSABinaryPlist::UUIDForm::Data, &why);
    if (!again) __builtin_trap();
    auto back = VSABinaryPlist::decode(again->data(), again->size(), &why);
    if (!back) __builtin_trap();
    auto third = VSABinaryPlist::encode(*back, VSABinaryPlist::UUIDForm::Data, &why);
    if (!third || *third != *again) __builtin_trap();
  }
  // The input as a stream of frames, fed in uneven pieces.
  VSAFrameReader reader;
  size_t pos = 0, step = 1;
  while (pos < size) {
    size_t n = std::min(step, size - pos);
    reader.append(data + pos, n);
    pos += n;
    step = step * 3 + 1;
    std::vector<uint8_t> payload;
    for (;;) {
      auto status = reader.next(payload);
      if (status != VSAFrameReader::Status::Frame) {
        if (status == VSAFrameReader::Status::Oversized) return 0;
        break;
      }
      (void)VSAFrameCodec::decodePayload(payload.data(), payload.size(), &why);
    }
  }
  return 0;
}
