// What the container operations ask of group containers: the groups an owner
// identifier is entitled to, and the reconciliation that queues the deletion
// of group containers nobody references. VSAGroupManager answers; declaring
// the calls here keeps the operations below code signing. Implementations are
// thread-safe; the daemon context owns the one it hands out and keeps it
// alive as long as everything it gave it to.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "model/VSAContainerClass.h"

class VSACommandQueue;

enum VSAGroupType : int { kVSAGroupTypeApplication = 0, kVSAGroupTypeSystem = 1 };

class VSAGroupQueries {
 public:
  virtual ~VSAGroupQueries() = default;

  // The group identifiers `owner` is entitled to, for group class 7 or 13;
  // nothing (and the code in `withError`) on failure. With `useLocking` the
  // all-identifiers lock is held for writing meanwhile.
  [[nodiscard]] virtual std::optional<std::vector<std::string>>
  groupContainerIdentifiersForOwnerIdentifier(const VSAValue* owner,
                                              VSAContainerClass groupContainerClass,
                                              bool useLocking, VSAResultCode* withError) = 0;
  // Queues the deletion of every group container of `groupType` (0
  // application, 1 system) that no identifier references.
  virtual void reconcileGroupContainersOfType(int groupType, VSACommandQueue& commandQueue) = 0;
};
