// The application termination service: while an assertion for a bundle
// identifier is held, the application is terminated and may not launch.
//
// On Linux the applications of a bundle identifier are the processes whose
// executable the client registry maps to that signing identifier. Taking an
// assertion kills them and records the hold in
// `<root>/run/vessad/termination-assertions/<bundle identifier>`, which the
// launcher consults before starting an application; the record goes when the
// last assertion for the identifier is invalidated. Acquisition is reported
// asynchronously. Thread-safe.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "base/VSAError.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSASystemRoot.h"

class VSAApplicationTerminationService
    : public std::enable_shared_from_this<VSAApplicationTerminationService> {
 public:
  using Handle = uint64_t;
  // The three termination reasons of the platform.
  enum class Reason { UserInitiated = 0, System = 1, Other = 2 };

  VSAApplicationTerminationService(VSASystemRoot root, std::shared_ptr<VSAClientRegistry> registry);

  // Creates an assertion; nothing when it cannot be created. `acquired` is
  // called later, with an error when the applications could not be stopped.
  std::optional<Handle> createAssertion(const std::string& bundleIdentifier, Reason reason,
                                        std::function<void(VSAErrorRef)> acquired);
  void invalidate(Handle handle);
  bool isHeld(const std::string& bundleIdentifier) const;
  std::string recordPath(const std::string& bundleIdentifier) const;

 private:
  int terminateProcessesOf(const std::string& bundleIdentifier);

  VSASystemRoot root_;
  std::shared_ptr<VSAClientRegistry> registry_;
  mutable std::mutex mutex_;
  Handle next_ = 1;
  std::map<Handle, std::string> handles_;
  std::map<std::string, int> holds_;
};
