// Fuzzes safe path resolution: the input names a path below a container in
// a fixed tree of directories and relative/absolute links; whatever
// realPathForURL accepts must lie strictly inside the container.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "base/VSALog.h"
#include "platform/VSAFileManager.h"
#include "platform/VSALinuxFileSystem.h"

namespace {
struct Tree {
  std::string root, base, realBase;
  VSAFileManager fm{std::make_shared<VSALinuxFileSystem>(),
                    std::make_shared<VSAUserDatabase>(VSASystemRoot("/"))};
  Tree() {
    VSALogger::shared().setLevel(0);  // rejections are expected; logging them only slows the run
    char tmpl[] = "/tmp/vessa-fuzz-paths-XXXXXX";
    root = mkdtemp(tmpl);
    base = root + "/container";
    for (const char* d :
         {"/container", "/container/a", "/container/a/b", "/container/c", "/outside"})
      mkdir((root + d).c_str(), 0755);
    symlink("../c", (base + "/a/up").c_str());            // stays inside
    symlink("../../outside", (base + "/a/out").c_str());  // climbs out
    symlink("..", (base + "/a/b/parent").c_str());
    symlink((root + "/outside").c_str(), (base + "/abs").c_str());
    symlink("loop", (base + "/loop").c_str());
    symlink("a/b", (base + "/deep").c_str());
    char buf[4096];
    realBase = realpath(base.c_str(), buf);
  }
};
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Tree* tree = new Tree();
  std::string suffix(reinterpret_cast<const char*>(data), size);
  if (suffix.find('\0') != std::string::npos) return 0;
  auto resolved = tree->fm.realPathForURL(tree->base + "/" + suffix, tree->base);
  if (resolved) {
    const std::string& r = *resolved;
    if (r.size() <= tree->realBase.size() + 1 ||
        r.compare(0, tree->realBase.size() + 1, tree->realBase + "/") != 0)
      __builtin_trap();  // escaped the container or resolved to the container itself
  }
  return 0;
}
