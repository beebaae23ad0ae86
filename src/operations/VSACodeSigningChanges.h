// What the container operations change in the code-signing records when
// containers change: a replaced bundle's records are invalidated, a deleted
// bundle's records go with it, and boot setup drops the advance copies.
// VSACodeSigningMapping does it; declaring the calls here keeps the
// operations below code signing. Implementations are thread-safe; the daemon
// context owns the one it hands out and keeps it alive as long as everything
// it gave it to.
#pragma once

#include <string>

#include "base/VSAError.h"

class VSACommandQueue;

class VSACodeSigningChanges {
 public:
  virtual ~VSACodeSigningChanges() = default;

  // Forgets what is cached of `identifier` and of its plug-ins.
  [[nodiscard]] virtual bool invalidateCodeSigningInfoForIdentifierAndItsChildren(
      const std::string& identifier, VSAErrorRef* error) = 0;
  // Removes the records of `identifier` and its plug-ins; what that frees
  // (group containers) is queued on `commandQueue`.
  virtual void removeCodeSigningDictionariesForIdentifierAndItsChildren(
      const std::string& identifier, VSACommandQueue* commandQueue) = 0;
  // Drops every advance copy of a record.
  [[nodiscard]] virtual bool removeAllAdvanceCopiesWithError(VSAErrorRef* error) = 0;
};
