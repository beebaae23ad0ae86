// The verbs of vessactl that people type ("create com.example.app --class
// data"), each turned into one request dictionary of the wire protocol, and
// the names people read: container classes by name, result codes with their
// meaning. Stateless.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAValue.h"

struct VSACtlVerb {
  const char* name;
  const char* arguments;  // as the help shows them
  const char* summary;
};

class VSACtlVerbs {
 public:
  static const std::vector<VSACtlVerb>& all();
  static const VSACtlVerb* find(const std::string& name);
  // The request for `verb` with its arguments (options included); nothing,
  // with the reason in `error`, for arguments that do not fit.
  static std::optional<VSAValue> request(const std::string& verb,
                                         const std::vector<std::string>& arguments,
                                         std::string* error);
  // "data" -> 2, "system-group" -> 13, "7" -> 7; nothing for anything else.
  static std::optional<uint64_t> classNamed(const std::string& text);
  static const char* className(uint64_t containerClass);
  // "container not found" for 21; "unknown result code" for codes without one.
  static const char* meaningOfCode(uint64_t code);
  // The verb's help: usage line, summary, options.
  static std::string help(const VSACtlVerb& verb);
};
