// Container classes: what kind of container, and so where it lives on disk
// and who owns it. base/VSAContainerClasses.h names them (0 "Undefined" and 14
// "MAX" are markers, no classes).
//
// Bundle classes {1,3,5,8} and system classes {12,13} are global; the
// per-user classes {2,4,6,7,9,10,11} live below a user's home. Pure
// functions; thread-safe.
#pragma once

#include <sys/types.h>

#include <cstdint>

#include "base/VSAContainerClasses.h"

// Owner of bundle containers (uid and gid) and of system containers.
inline constexpr uid_t CONTAINER_INSTALLATION_UID = 33;
inline constexpr uid_t CONTAINER_SYSTEM_UID = 0;

// The per-user classes and the global ones (bundle and system), in
// increasing order.
inline constexpr VSAContainerClass kVSAPerUserContainerClasses[] = {
    VSAClass::kDataApplication, VSAClass::kDataPlugin,       VSAClass::kDataVPNPlugin,
    VSAClass::kAppGroup,        VSAClass::kDataRelayService, VSAClass::kDataInternalDaemon,
    VSAClass::kDataTempDir};
inline constexpr VSAContainerClass kVSAGlobalContainerClasses[] = {
    VSAClass::kBundleApplication, VSAClass::kBundlePlugin, VSAClass::kBundleVPNPlugin,
    VSAClass::kBundleFramework,   VSAClass::kSystemData,   VSAClass::kSystemGroup};

// "Bundle/Application" ...; "Undefined" for 0, "MAX" from 14 on.
const char* VSAContainerClassPathComponent(VSAContainerClass containerClass);
bool VSAContainerClassIsValid(VSAContainerClass c);    // 1..13
bool VSAContainerClassIsBundle(VSAContainerClass c);   // 1, 3, 5, 8
bool VSAContainerClassIsSystem(VSAContainerClass c);   // 12, 13
bool VSAContainerClassIsPerUser(VSAContainerClass c);  // 2, 4, 6, 7, 9, 10, 11
bool VSAContainerClassIsGroup(VSAContainerClass c);    // 7, 13
