// The container classes by name.
//
// A container class is a number: it is stored in metadata files and the
// code-signing database, sent by clients and handed to the sandbox, so it is
// a plain integer and a value a client sends may be any number (check it with
// VSAContainerClassIsValid, model/VSAContainerClass.h, before use). This list
// gives every class its name, its number (never renumbered) and the path
// component of its directory. Kept at the bottom layer because the platform's
// sandbox and sub-directory tables are keyed by class too. Constant.
#pragma once

#include <cstdint>

using VSAContainerClass = uint64_t;

// Every class, in increasing order: (name, number, path component).
#define VSA_CONTAINER_CLASSES(X)                    \
  X(kBundleApplication, 1, "Bundle/Application")    \
  X(kDataApplication, 2, "Data/Application")        \
  X(kBundlePlugin, 3, "Bundle/PlexaPlugin")         \
  X(kDataPlugin, 4, "Data/PlexaPlugin")             \
  X(kBundleVPNPlugin, 5, "Bundle/VPNPlugin")        \
  X(kDataVPNPlugin, 6, "Data/VPNPlugin")            \
  X(kAppGroup, 7, "Shared/AppGroup")                \
  X(kBundleFramework, 8, "Bundle/Framework")        \
  X(kDataRelayService, 9, "Data/RelayService")      \
  X(kDataInternalDaemon, 10, "Data/InternalDaemon") \
  X(kDataTempDir, 11, "Data/TempDir")               \
  X(kSystemData, 12, "Data/System")                 \
  X(kSystemGroup, 13, "Shared/SystemGroup")

namespace VSAClass {
// No class: the "Undefined" marker, also what a record without a class holds.
constexpr VSAContainerClass kUndefined = 0;
#define VSA_CONTAINER_CLASS_CONSTANT(name, value, pathComponent) \
  constexpr VSAContainerClass name = value;
VSA_CONTAINER_CLASSES(VSA_CONTAINER_CLASS_CONSTANT)
#undef VSA_CONTAINER_CLASS_CONSTANT
}  // namespace VSAClass

// The first and the last class.
inline constexpr VSAContainerClass kVSAContainerClassMin = VSAClass::kBundleApplication;
inline constexpr VSAContainerClass kVSAContainerClassMax = VSAClass::kSystemGroup;
