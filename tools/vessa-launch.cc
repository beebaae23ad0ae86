// vessa-launch: starts a program as an app, confined to the app's own
// containers (see VSALauncher).
#include <cstdio>

#include "VSALaunchOptions.h"
#include "VSALauncher.h"
#include "platform/VSALandlock.h"

int main(int argc, char** argv) {
  std::string why;
  bool help = false;
  auto options = VSALaunchOptions::parse(argc, argv, &why, &help);
  if (help) return std::fputs(VSALaunchOptions::usage(), stdout), 0;
  if (!options) {
    std::fprintf(stderr, "vessa-launch: %s\n%s", why.c_str(), VSALaunchOptions::usage());
    return kVSALaunchFailed;
  }
  VSALinuxLandlock landlock;
  return VSALauncher(std::move(*options), landlock).run();
}
