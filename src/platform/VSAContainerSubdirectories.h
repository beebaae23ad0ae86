// The default sub-directories of a new container, per container class.
//
// A built-in table, which the root's `etc/vessad/subdirectories.plist` may
// override class by class: a dictionary from the class number (as a string)
// to an array of relative directory names, created in that order. A name
// that is absolute, empty or climbs out with ".." makes that class's entry
// invalid (logged, built-in list kept). Read once; immutable and shareable.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/VSAContainerClasses.h"
#include "base/VSAError.h"
#include "platform/VSASystemRoot.h"

class VSAContainerSubdirectories {
 public:
  explicit VSAContainerSubdirectories(const VSASystemRoot& root);
  VSAContainerSubdirectories() : table_(builtIn()) {}

  // container_subdirectories_for_class: the names, or nothing (with a code)
  // for a class the table does not know.
  std::optional<std::vector<std::string>> subdirectoriesForClass(VSAContainerClass containerClass,
                                                                 VSAResultCode* error) const;
  static const std::map<VSAContainerClass, std::vector<std::string>>& builtIn();

 private:
  std::map<VSAContainerClass, std::vector<std::string>> table_;
};
