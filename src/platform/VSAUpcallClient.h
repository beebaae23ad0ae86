// The kernel's end of the upcall socket, for the vessa-upcall tool, tests
// and benchmarks: sends one request packet with its memory as a memfd and
// receives the reply packet and its memfd's bytes. One call at a time.
#pragma once

#include <optional>
#include <string>
#include <vector>

class VSAUpcallClient {
 public:
  VSAUpcallClient() = default;
  ~VSAUpcallClient();
  VSAUpcallClient(const VSAUpcallClient&) = delete;
  VSAUpcallClient& operator=(const VSAUpcallClient&) = delete;

  bool connect(const std::string& socketPath, std::string* why);
  bool isConnected() const { return fd_ >= 0; }
  // `memory` travels as a memfd when given. The reply's memory, when it
  // carried one, lands in `replyMemory`.
  bool call(const std::vector<uint8_t>& message, const std::vector<uint8_t>* memory,
            std::vector<uint8_t>* reply, std::optional<std::vector<uint8_t>>* replyMemory,
            std::string* why, int timeoutMilliseconds = 30000);

 private:
  int fd_ = -1;
};
