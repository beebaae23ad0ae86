// Keeps one application from running while the daemon changes something
// underneath it: a synchronous wrapper around the termination service.
//
// initWithBundleIdentifier blocks until the service has acquired the
// assertion (never call it on a queue the service's answer needs). Reasons
// -1, 0 and 1 map onto the service's three reasons; anything else is a
// programming error that ends the process. The holder must invalidate()
// before releasing the object: releasing a held assertion ends the process.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/VSAApplicationTerminationService.h"

class VSAApplicationTerminationAssertion {
 public:
  // Nothing when the service is unavailable (null), the assertion cannot be
  // made, or acquisition failed (logged).
  static std::unique_ptr<VSAApplicationTerminationAssertion> initWithBundleIdentifier(
      VSAApplicationTerminationService* service, const std::string& bundleIdentifier, int reason);
  ~VSAApplicationTerminationAssertion();

  void invalidate();
  bool isHeld() const { return termAssertion_.has_value(); }

  VSAApplicationTerminationAssertion(VSAApplicationTerminationService* service,
                                     VSAApplicationTerminationService::Handle handle)
      : service_(service), termAssertion_(handle) {}

 private:
  VSAApplicationTerminationService* service_;
  std::optional<VSAApplicationTerminationService::Handle> termAssertion_;
};
