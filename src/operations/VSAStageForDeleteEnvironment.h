// What staging containers for deletion needs: the container cache, the
// directory layout (death row) with its file manager, and a way to forget
// the code-signing records of a deleted bundle (the code-signing mapping's,
// passed as a function so that operations stay below code signing).
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "model/VSAContainerCache.h"
#include "model/VSAGlobalConfiguration.h"

class VSACommandQueue;

struct VSAStageForDeleteEnvironment {
  std::shared_ptr<VSAContainerCache> cache;
  std::shared_ptr<VSAGlobalConfiguration> configuration;
  std::function<void(const std::string& identifier, VSACommandQueue& queue)> removeCodeSigning;
};
