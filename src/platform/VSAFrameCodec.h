// Framing of IPC messages on a stream socket.
//
// A frame is a 4-byte big-endian payload length followed by that many bytes
// of one binary property list (UUIDs travel as 16 bytes of data). Frames
// larger than kMaxFrameSize are refused: the stream cannot be trusted past
// them, so the connection is dropped. VSAFrameReader reassembles frames from
// arbitrary read sizes. Not synchronised (one reader per connection).
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAValue.h"

class VSAFrameCodec {
 public:
  static constexpr uint32_t kMaxFrameSize = 4u << 20;  // 4 MiB

  static std::optional<std::vector<uint8_t>> encode(const VSAValue& message, VSAErrorRef* error);
  // Decodes a payload into a value of any type (the caller checks for a dictionary).
  static std::optional<VSAValue> decodePayload(const uint8_t* bytes, size_t length,
                                               std::string* why);
};

class VSAFrameReader {
 public:
  enum class Status { NeedMore, Frame, Oversized };

  void append(const uint8_t* bytes, size_t length);
  // Takes the next complete payload out of the buffer.
  Status next(std::vector<uint8_t>& payload);
  // Bytes of an incomplete frame left over (non-zero at EOF means truncation).
  size_t pending() const { return buffer_.size() - consumed_; }
  uint32_t oversizedLength() const { return oversized_; }

 private:
  std::vector<uint8_t> buffer_;
  size_t consumed_ = 0;
  uint32_t oversized_ = 0;
};
