// What the container operations and the migrations need of data protection:
// the class an app's entitlements ask for its data container (applied when
// the container is made), and, at boot, the restart of the protection
// changes that a stop interrupted. VSADataProtectionManager answers;
// declaring the calls here keeps the operations below data protection.
// Implementations are thread-safe; the daemon context owns the one it hands
// out and keeps it alive as long as everything it gave it to.
#pragma once

#include <cstdint>
#include <string>

#include "base/VSAError.h"

class VSADataProtectionQueries {
 public:
  virtual ~VSADataProtectionQueries() = default;

  // The protection class the identifier's entitlements ask for (0: none).
  virtual int32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
      const std::string& identifier) = 0;
  // Restarts the changes persisted before the last stop.
  [[nodiscard]] virtual bool restartPendingDataProtectionOperationsWithError(
      VSAErrorRef* error) = 0;
};
