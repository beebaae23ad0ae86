#include "model/VSAContainerClass.h"

#include <iterator>

namespace {
// Indexed by class: "Undefined", every class in order, then "MAX".
#define VSA_CONTAINER_CLASS_PATH(name, value, pathComponent) pathComponent,
const char* const kPathComponents[] = {"Undefined",
                                       VSA_CONTAINER_CLASSES(VSA_CONTAINER_CLASS_PATH) "MAX"};
#undef VSA_CONTAINER_CLASS_PATH
static_assert(std::size(kPathComponents) == kVSAContainerClassMax + 2);
}  // namespace

const char* VSAContainerClassPathComponent(VSAContainerClass c) {
  return c < std::size(kPathComponents) ? kPathComponents[c] : "MAX";
}

bool VSAContainerClassIsValid(VSAContainerClass c) {
  return c >= kVSAContainerClassMin && c <= kVSAContainerClassMax;
}

bool VSAContainerClassIsBundle(VSAContainerClass c) {
  using namespace VSAClass;
  return c == kBundleApplication || c == kBundlePlugin || c == kBundleVPNPlugin ||
         c == kBundleFramework;
}
bool VSAContainerClassIsSystem(VSAContainerClass c) {
  return c == VSAClass::kSystemData || c == VSAClass::kSystemGroup;
}
bool VSAContainerClassIsGroup(VSAContainerClass c) {
  return c == VSAClass::kAppGroup || c == VSAClass::kSystemGroup;
}

bool VSAContainerClassIsPerUser(VSAContainerClass c) {
  return VSAContainerClassIsValid(c) && !VSAContainerClassIsBundle(c) &&
         !VSAContainerClassIsSystem(c);
}
