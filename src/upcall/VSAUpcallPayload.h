// The kernel's side of the upcall's pack buffers: a request built from what
// the kernel knows about a launching process, and a reply read back into
// its paths. Used by the vessa-upcall tool, tests and benchmarks; the daemon
// itself reads requests and writes replies in VSAUpcallServer.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

struct VSAUpcallProcess {
  std::optional<std::string> codeSignatureID, containerID, applicationID, systemContainerID;
  std::optional<uint32_t> uid, sandboxType, personaID;
  std::vector<std::string> groups, systemGroups;

  // The request pack buffer's bytes; nothing when an item cannot be packed.
  std::optional<std::vector<uint8_t>> pack() const;
};

struct VSAUpcallAnswer {
  std::optional<std::string> home, dataContainer, temporaryDirectory, systemContainer;
  std::vector<std::pair<std::string, std::string>> groups, systemGroups;
  std::optional<uint32_t> success;
  bool malformed = false;  // an item could not be read, or is of a kind not expected

  static VSAUpcallAnswer read(const std::vector<uint8_t>& bytes);
};
