// vessa-launch's work: from the command line to a confined, running app.
//
//   1. who: the app's user (and group) from the device's user database, its
//      persona from the device's persona list;
//   2. where: its containers from the daemon through the upcall, as the
//      kernel asks at exec (they are made when missing), and its bundle
//      container through a look-up sent first and read last;
//   3. the rules: one Landlock ruleset over those containers;
//   4. the child (cloned without copying the launcher's memory): records
//      itself for the daemon (persona and signing identifier, keyed by pid
//      and start time) while still root; then it takes the app's user, HOME
//      and TMPDIR, no_new_privs and the ruleset, and execs;
//   5. the wait: signals are passed on, the records removed as the child
//      ends (before it is reaped), the child's status returned.
// Every failure names its step; the launcher's own failures exit 125.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "VSALaunchOptions.h"
#include "VSALaunchRules.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSALandlock.h"
#include "platform/VSASystemRoot.h"
#include "platform/VSAUpcallClient.h"

inline constexpr int kVSALaunchFailed = 125;
inline constexpr int kVSALaunchCannotExecute = 126;
inline constexpr int kVSALaunchNotFound = 127;

class VSALauncher {
 public:
  VSALauncher(VSALaunchOptions options, VSALandlock& landlock);
  // The exit status vessa-launch ends with.
  int run();

 private:
  int fail(const std::string& step, const std::string& why) const;
  bool resolveUser(std::string* why);
  bool resolvePersona(std::string* why);
  // The upcall on a connected client.
  bool askForContainers(VSAUpcallClient& client, std::string* step, std::string* why);
  // Sends the look-up of the app's bundle container; its message id, or
  // nothing when the daemon cannot be reached (the app then has no bundle).
  std::optional<uint64_t> askForBundle(VSAIPCClient& client) const;
  void receiveBundle(VSAIPCClient& client, std::optional<uint64_t> messageID);
  VSAValue description(const VSALaunchRules& rules) const;
  // The ruleset's descriptor; -1 when the app is to run unconfined (allowed
  // by --unconfined, and said); nothing after a failure was reported.
  std::optional<int> confinement(const VSALaunchRules& rules);
  int startAndWait(int ruleset);

  VSALaunchOptions options_;
  VSALandlock& landlock_;
  VSASystemRoot root_;
  uid_t uid_ = 0;
  gid_t gid_ = 0;
  uint32_t personaID_ = 0;
  VSALaunchContainers containers_;
  int abi_ = 0;
};
