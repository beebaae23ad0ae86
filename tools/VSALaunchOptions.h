// vessa-launch's command line.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

struct VSALaunchOptions {
  std::string root = "/";
  std::string signingIdentifier;
  std::optional<uid_t> uid;           // default: the device's mobile user
  std::optional<uint32_t> personaID;  // default: the device's personal persona
  bool plugin = false;
  std::vector<std::string> groups;
  std::optional<std::string> systemContainer;
  std::vector<std::string> systemGroups;
  std::vector<std::string> allowRead, allowWrite;
  bool unconfined = false;
  bool printRules = false;
  bool verbose = false;
  std::vector<std::string> program;  // after "--": the program and its arguments

  // Parses argv; nothing (after writing why to `why`) for a bad command line.
  // `help` is set for -h/--help.
  static std::optional<VSALaunchOptions> parse(int argc, char** argv, std::string* why, bool* help);
  static const char* usage();
};
