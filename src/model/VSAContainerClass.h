// Container classes: what kind of container, and so where it lives on disk
// and who owns it.
//
//   1 Bundle/Application   2 Data/Application    3 Bundle/PlexaPlugin
//   4 Data/PlexaPlugin     5 Bundle/VPNPlugin    6 Data/VPNPlugin
//   7 Shared/AppGroup      8 Bundle/Framework    9 Data/RelayService
//  10 Data/InternalDaemon 11 Data/TempDir       12 Data/System
//  13 Shared/SystemGroup   (0 "Undefined" and 14 "MAX" are markers)
//
// Bundle classes {1,3,5,8} and system classes {12,13} are global; the
// per-user classes {2,4,6,7,9,10,11} live below a user's home. Pure
// functions; thread-safe.
#pragma once

#include <sys/types.h>

#include <cstdint>

using VSAContainerClass = uint64_t;

// Owner of bundle containers (uid and gid) and of system containers.
inline constexpr uid_t CONTAINER_INSTALLATION_UID = 33;
inline constexpr uid_t CONTAINER_SYSTEM_UID = 0;

inline constexpr VSAContainerClass kVSAContainerClassMin = 1;
inline constexpr VSAContainerClass kVSAContainerClassMax = 13;

// "Bundle/Application" ...; only for 0..14.
const char* VSAContainerClassPathComponent(VSAContainerClass containerClass);
bool VSAContainerClassIsValid(VSAContainerClass c);    // 1..13
bool VSAContainerClassIsBundle(VSAContainerClass c);   // 1, 3, 5, 8
bool VSAContainerClassIsSystem(VSAContainerClass c);   // 12, 13
bool VSAContainerClassIsPerUser(VSAContainerClass c);  // 2, 4, 6, 7, 9, 10, 11
bool VSAContainerClassIsGroup(VSAContainerClass c);    // 7, 13
