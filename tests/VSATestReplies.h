// Reads every complete reply frame waiting on a test's end of a socket pair.
#pragma once

#include <sys/socket.h>

#include <vector>

#include "base/VSAValue.h"
#include "platform/VSAFrameCodec.h"

inline std::vector<VSAValue> VSADrainReplies(int fd) {
  std::vector<VSAValue> out;
  VSAFrameReader reader;
  uint8_t buf[65536];
  for (;;) {
    ssize_t n = recv(fd, buf, sizeof buf, MSG_DONTWAIT);
    if (n <= 0) break;
    reader.append(buf, n);
  }
  std::vector<uint8_t> payload;
  while (reader.next(payload) == VSAFrameReader::Status::Frame) {
    std::string why;
    out.push_back(*VSAFrameCodec::decodePayload(payload.data(), payload.size(), &why));
  }
  return out;
}
