#include "platform/VSAFrameCodec.h"

#include "base/VSABinaryPlist.h"

std::optional<std::vector<uint8_t>> VSAFrameCodec::encode(const VSAValue& message,
                                                          VSAErrorRef* error) {
  std::string why;
  auto payload = VSABinaryPlist::encode(message, VSABinaryPlist::UUIDForm::Data, &why);
  if (!payload) {
    VSASetError(error, VSA_ERROR(VSAResult::kInvalidArgument, "Cannot encode message: %s", why));
    return std::nullopt;
  }
  if (payload->size() > kMaxFrameSize) {
    VSASetError(error, VSA_ERROR(VSAResult::kInvalidArgument, "Message of %zu bytes is too large",
                                 payload->size()));
    return std::nullopt;
  }
  uint32_t n = static_cast<uint32_t>(payload->size());
  const uint8_t header[4] = {static_cast<uint8_t>(n >> 24), static_cast<uint8_t>(n >> 16),
                             static_cast<uint8_t>(n >> 8), static_cast<uint8_t>(n)};
  // In place: the encoder leaves room, so the header costs no second buffer.
  payload->insert(payload->begin(), header, header + 4);
  return payload;
}

std::optional<VSAValue> VSAFrameCodec::decodePayload(const uint8_t* bytes, size_t length,
                                                     std::string* why) {
  if (!VSABinaryPlist::isBinaryPlist(bytes, length)) {
    if (why) *why = "payload is not a binary property list";
    return std::nullopt;
  }
  return VSABinaryPlist::decode(bytes, length, why);
}

void VSAFrameReader::append(const uint8_t* bytes, size_t length) {
  if (consumed_ > 0 && consumed_ == buffer_.size()) {
    buffer_.clear();
    consumed_ = 0;
  } else if (consumed_ > 65536) {
    buffer_.erase(buffer_.begin(), buffer_.begin() + consumed_);
    consumed_ = 0;
  }
  buffer_.insert(buffer_.end(), bytes, bytes + length);
}

VSAFrameReader::Status VSAFrameReader::next(std::vector<uint8_t>& payload) {
  if (pending() < 4) return Status::NeedMore;
  const uint8_t* p = buffer_.data() + consumed_;
  uint32_t n = (uint32_t(p[0]) << 24) | (uint32_t(p[1]) << 16) | (uint32_t(p[2]) << 8) | p[3];
  if (n > VSAFrameCodec::kMaxFrameSize) {
    oversized_ = n;
    return Status::Oversized;
  }
  if (pending() - 4 < n) return Status::NeedMore;
  payload.assign(p + 4, p + 4 + n);
  consumed_ += 4 + n;
  return Status::Frame;
}
