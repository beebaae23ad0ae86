// What the container model, the operations, data protection and the
// migrations read from the code-signing records of an identifier: its
// entitlements, whether they ask for a system container, and the parent app
// of a plug-in. VSACodeSigningMapping answers from its database; declaring
// the questions here keeps everything below code signing free of it.
// Implementations are thread-safe; the daemon context owns the one it hands
// out and keeps it alive as long as everything it gave it to.
#pragma once

#include <optional>
#include <string>

#include "base/VSAValue.h"

class VSACodeSigningQueries {
 public:
  virtual ~VSACodeSigningQueries() = default;

  // The entitlements recorded for `identifier` (placeholders and advance
  // copies included), or nothing.
  virtual std::optional<VSAValue> entitlementsForIdentifier(const std::string& identifier) = 0;
  // Do the identifier's entitlements ask for a system container?
  virtual bool identifierHasSystemContainer(const std::string& identifier) = 0;
  // The app a plug-in belongs to, when its records name one.
  virtual std::optional<std::string> parentIdentifierForChildIdentifier(
      const std::string& child) = 0;
};
