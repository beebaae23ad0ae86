// What staging containers for deletion needs: the container cache, the
// directory layout (death row) with its file manager, the lock table and test
// locks, and the code-signing records that go with a deleted bundle (reached
// through their interface, so that operations stay below code signing; whoever
// fills the environment keeps that object alive as long as the environment).
#pragma once

#include <memory>
#include <string>

#include "base/VSALocks.h"
#include "base/VSATestLocks.h"
#include "model/VSAContainerCache.h"
#include "model/VSAGlobalConfiguration.h"
#include "operations/VSACodeSigningChanges.h"

struct VSAStageForDeleteEnvironment {
  std::shared_ptr<VSAContainerCache> cache;
  std::shared_ptr<VSAGlobalConfiguration> configuration;
  std::shared_ptr<VSALocks> locks;
  std::shared_ptr<VSATestLocks> testLocks;
  VSACodeSigningChanges* codeSigning = nullptr;  // never null once filled
};
