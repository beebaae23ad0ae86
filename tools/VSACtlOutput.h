// vessactl's replies for people: a container list as a table, sizes in
// units people read (with the exact byte count), every other reply key as
// a "Key: value" line (the UUID as text). Stateless.
#pragma once

#include <string>

#include "base/VSAValue.h"

class VSACtlOutput {
 public:
  static std::string forPeople(const VSAValue& reply);

 private:
  static std::string containerTable(const VSAValue& reply);
};
