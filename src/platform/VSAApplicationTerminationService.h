// The application termination service: while an assertion for a bundle
// identifier is held, the application is terminated and may not launch.
//
// On Linux the applications of a bundle identifier are the processes that run
// one of the files this system root's client registry names for that signing
// identifier: each entry's "Executable", looked up inside the root without
// following links, is compared by device and inode with /proc/<pid>/exe.
// Several roots (and their daemons) share one host, and the same program may
// be registered in each of them; a process running another root's file, or a
// file that a root's entry reaches only through a link, is not this root's.
//
// Taking an assertion records the hold in
// `<root>/run/vessad/termination-assertions/<bundle identifier>`, which the
// launcher consults before starting an application, and then kills the
// processes; a hold that cannot be recorded is no hold, and taking the
// assertion fails. The record goes when the last assertion for the
// identifier is invalidated. Bundle identifiers that are not plain file names
// are refused. Acquisition is reported asynchronously. Thread-safe.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "base/VSAError.h"
#include "platform/VSAClientRegistry.h"
#include "platform/VSAFileSystem.h"
#include "platform/VSASystemRoot.h"

class VSAApplicationTerminationService
    : public std::enable_shared_from_this<VSAApplicationTerminationService> {
 public:
  using Handle = uint64_t;
  // The three termination reasons of the platform.
  enum class Reason { UserInitiated = 0, System = 1, Other = 2 };

  // `fileSystem` examines the registered executables (a link-refusing Linux
  // file system when null).
  VSAApplicationTerminationService(VSASystemRoot root, std::shared_ptr<VSAClientRegistry> registry,
                                   std::shared_ptr<VSAFileSystem> fileSystem = nullptr);

  // Creates an assertion; nothing when it cannot be created (a bundle
  // identifier that is not a safe file name, or a hold that could not be
  // recorded). `acquired` is called later, with an error when the
  // applications could not be stopped.
  std::optional<Handle> createAssertion(const std::string& bundleIdentifier, Reason reason,
                                        std::function<void(VSAErrorRef)> acquired);
  void invalidate(Handle handle);
  bool isHeld(const std::string& bundleIdentifier) const;
  std::string recordPath(const std::string& bundleIdentifier) const;

 private:
  int terminateProcessesOf(const std::string& bundleIdentifier);

  VSASystemRoot root_;
  std::shared_ptr<VSAClientRegistry> registry_;
  std::shared_ptr<VSAFileSystem> fileSystem_;
  mutable std::mutex mutex_;
  Handle next_ = 1;
  std::map<Handle, std::string> handles_;
  std::map<std::string, int> holds_;
};
