#include "model/VSAContainerClass.h"

namespace {
const char* const kPathComponents[] = {
    "Undefined",          "Bundle/Application",  "Data/Application",
    "Bundle/PlexaPlugin", "Data/PlexaPlugin",    "Bundle/VPNPlugin",
    "Data/VPNPlugin",     "Shared/AppGroup",     "Bundle/Framework",
    "Data/RelayService",  "Data/InternalDaemon", "Data/TempDir",
    "Data/System",        "Shared/SystemGroup",  "MAX"};
}

const char* VSAContainerClassPathComponent(VSAContainerClass c) {
  return c <= 14 ? kPathComponents[c] : "MAX";
}

bool VSAContainerClassIsValid(VSAContainerClass c) {
  return c >= kVSAContainerClassMin && c <= kVSAContainerClassMax;
}

bool VSAContainerClassIsBundle(VSAContainerClass c) { return c == 1 || c == 3 || c == 5 || c == 8; }
bool VSAContainerClassIsSystem(VSAContainerClass c) { return c == 12 || c == 13; }
bool VSAContainerClassIsGroup(VSAContainerClass c) { return c == 7 || c == 13; }

bool VSAContainerClassIsPerUser(VSAContainerClass c) {
  return VSAContainerClassIsValid(c) && !VSAContainerClassIsBundle(c) &&
         !VSAContainerClassIsSystem(c);
}
