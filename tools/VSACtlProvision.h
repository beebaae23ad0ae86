// `vessactl provision`: lays out the least a system root needs before vessad
// can serve from it, with safe defaults:
//  - the mobile user (and the "systemusers" group): in `<root>/etc/passwd`
//    and `<root>/etc/group` for a root other than "/", through the system's
//    own useradd/groupadd on "/";
//  - `etc/vessad/device.plist` (no internal content), `personas.plist` (one
//    personal persona), `system-version.plist` (the build the device runs);
//  - the client registry: this vessactl as the administrator's full client,
//    for root only, and vessa-upcall / vessa-launch (when they sit beside
//    this program) as the kernel bridge. Below a root other than "/" the
//    programs are copied in, root-owned and writable by root alone, since the
//    daemon refuses entries whose program others could rewrite.
// A file that exists is kept (and said so) unless --force. Exit status 0
// when the root can be served, 1 when something could not be written, 2 for
// usage errors.
#pragma once

#include <string>
#include <vector>

class VSACtlProvision {
 public:
  static const char* help();
  // `arguments` are what follows the verb.
  static int run(const std::string& root, const std::vector<std::string>& arguments);
};
