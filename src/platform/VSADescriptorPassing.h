// Passing file descriptors over Unix sockets (SCM_RIGHTS) and the memfds the
// upcall's out-of-line memory travels in. Shared by the upcall listener and
// its client. Stateless; thread-safe.
#pragma once

#include <sys/socket.h>
#include <sys/types.h>

#include <cstdint>
#include <vector>

// Sends `bytes` as one message with `fd` attached (none when fd < 0).
ssize_t VSASendWithDescriptor(int socket, const std::vector<uint8_t>& bytes, int fd, int flags);
// The descriptors a received message carried (the caller closes them).
std::vector<int> VSAReceivedDescriptors(struct msghdr& message);
// A memfd holding `bytes`, sealed against any change when `seal`; -1 on failure.
int VSAMemfdWithBytes(const char* name, const std::vector<uint8_t>& bytes, bool seal);
