// JSON conversion of VSAValue, for vessactl's request files and --json output.
//
// Parsing: objects, arrays, strings (with \u escapes and surrogate pairs),
// true/false/null, integers (negative -> signed, otherwise unsigned) and
// reals; nesting is bounded. Printing: UUIDs as their text, data as
// {"$data": "<hex>"}, dates as {"$date": <seconds since 1970>}. Stateless.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/VSAValue.h"

class VSAJSON {
 public:
  static std::optional<VSAValue> parse(std::string_view text, std::string* error);
  static std::string print(const VSAValue& value, bool pretty = true);
};
