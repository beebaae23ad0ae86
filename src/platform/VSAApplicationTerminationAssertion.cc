#include "platform/VSAApplicationTerminationAssertion.h"

#include <future>

#include "base/VSACrash.h"
#include "base/VSALog.h"

std::unique_ptr<VSAApplicationTerminationAssertion>
VSAApplicationTerminationAssertion::initWithBundleIdentifier(
    VSAApplicationTerminationService* service, const std::string& bundleIdentifier, int reason) {
  const char* fn = "initWithBundleIdentifier";
  if (!service) {
    VSALog(kVSALogError, fn, "Attempted to use termation assertions with LCS not avaible");
    return nullptr;
  }
  if (reason < -1 || reason > 1) VSACrash(VSAFormat("Invalid termination reason: %d", reason));
  auto platformReason = static_cast<VSAApplicationTerminationService::Reason>(reason + 1);
  auto done = std::make_shared<std::promise<bool>>();
  auto result = done->get_future();
  auto handle = service->createAssertion(
      bundleIdentifier, platformReason, [done, bundleIdentifier](VSAErrorRef error) {
        if (error)
          VSALog(kVSALogError, "initWithBundleIdentifier",
                 "Failed to acquire termination assertion for %@ : %@", bundleIdentifier, error);
        done->set_value(!error);
      });
  if (!handle) {
    VSALog(kVSALogError, fn, "Failed to get LCSApplicationTerminationAssertion");
    return nullptr;
  }
  if (!result.get()) {
    service->invalidate(*handle);
    return nullptr;
  }
  return std::make_unique<VSAApplicationTerminationAssertion>(service, *handle);
}

void VSAApplicationTerminationAssertion::invalidate() {
  if (!termAssertion_) return;
  service_->invalidate(*termAssertion_);
  termAssertion_.reset();
}

VSAApplicationTerminationAssertion::~VSAApplicationTerminationAssertion() {
  if (termAssertion_) VSACrash("Assertion failed: nil == self.termAssertion");
}
