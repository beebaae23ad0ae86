// The upcall's messages as bytes, host byte order.
//
// Request (kernel to daemon), 56 bytes:
//   0 header bits (the complex bit 0x80000000 must be set), 4 size (56),
//   8 reply port, 12 local port, 16 voucher, 20 message id,
//   24 descriptor count (1), 28 out-of-line descriptor: 28 address (unused
//   here: the memory travels as a memfd), 39 type (1 = out-of-line memory),
//   40 size; 44 NDR record; 52 request size (= the descriptor size).
// The receiver appends the trailer it builds itself: type (0) and size
// (32), then the sender's 32-byte audit token.
//
// Replies, id = request id + 100, remote port = the request's reply port:
//   served (return code 0): 56 bytes with the complex bit, descriptor count
//     1, the descriptor (type 1, size = the reply buffer's bytes), NDR, and
//     the reply size; the reply buffer travels as a memfd;
//   refused or failed (any other return code): 36 bytes, header, NDR and the
//     32-bit return code, no memory.
// Value types and pure functions; the parsers accept any bytes.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <vector>

inline constexpr uint32_t kVSAUpcallGetProcessContainersID = 322514900;
inline constexpr uint32_t kVSAUpcallReplyIDOffset = 100;
inline constexpr uint32_t kVSAUpcallRequestSize = 56;
inline constexpr uint32_t kVSAUpcallServedReplySize = 56;
inline constexpr uint32_t kVSAUpcallErrorReplySize = 36;
inline constexpr uint32_t kVSAUpcallComplexBit = 0x80000000u;
inline constexpr uint32_t kVSAUpcallTrailerSize = 32;

// Return codes of the upcall (32-bit, signed).
inline constexpr int32_t kVSAUpcallSuccess = 0;
inline constexpr int32_t kVSAUpcallInvalidArgument = 4;
inline constexpr int32_t kVSAUpcallFailure = 5;
inline constexpr int32_t kVSAUpcallNoMemory = 9;
inline constexpr int32_t kVSAUpcallTypeError = -300;
inline constexpr int32_t kVSAUpcallBadID = -303;
inline constexpr int32_t kVSAUpcallTrailerError = -309;

struct VSAUpcallRequest {
  uint32_t bits = kVSAUpcallComplexBit;
  uint32_t size = kVSAUpcallRequestSize;
  uint32_t replyPort = 0;
  uint32_t id = kVSAUpcallGetProcessContainersID;
  uint32_t descriptorCount = 1;
  uint8_t descriptorType = 1;
  uint32_t descriptorSize = 0;
  uint32_t requestSize = 0;
  // The trailer the receiver built.
  uint32_t trailerType = 0;
  uint32_t trailerSize = kVSAUpcallTrailerSize;
  std::array<uint8_t, 32> auditToken{};

  // Reads the fields of a message of any length (missing bytes read as 0);
  // `messageLength` is what arrived, kept so that validation can refuse it.
  static VSAUpcallRequest parse(const uint8_t* bytes, size_t messageLength);
  size_t messageLength = kVSAUpcallRequestSize;

  std::vector<uint8_t> bytes() const;  // the 56-byte message
  // 0 when the message is well formed for a buffer of `memorySize` bytes;
  // else kVSAUpcallTypeError or kVSAUpcallTrailerError.
  int32_t validate(uint64_t memorySize) const;
  // The audit token's process id (0 = the kernel).
  uint32_t senderPID() const;
};

struct VSAUpcallReply {
  uint32_t id = 0;
  uint32_t remotePort = 0;
  int32_t returnCode = 0;
  uint32_t replySize = 0;  // served replies: the reply buffer's size (0 when not copied)

  static VSAUpcallReply forRequest(const VSAUpcallRequest& request, int32_t returnCode);
  std::vector<uint8_t> bytes() const;  // 56 bytes when served, 36 otherwise
  static std::optional<VSAUpcallReply> parse(const uint8_t* bytes, size_t length);
};
