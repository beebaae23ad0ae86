// The process-wide user identity cache: a cache with no state of its own
// that the daemon creates once at start-up and every subsystem shares.
#pragma once

#include "model/VSAUserIdentityCache.h"

class VSAUserIdentitySharedCache : public VSAUserIdentityCache {
 public:
  static std::shared_ptr<VSAUserIdentitySharedCache> create(Dependencies deps, Options options);
  static std::shared_ptr<VSAUserIdentitySharedCache> create(Dependencies deps) {
    return create(std::move(deps), Options());
  }

 private:
  VSAUserIdentitySharedCache(Dependencies deps, Options options)
      : VSAUserIdentityCache(std::move(deps), std::move(options)) {}
};
