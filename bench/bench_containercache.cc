// Building one class map of 10,000 containers (listing the class directory,
// directory-name checks, metadata validation, the class-path check, the
// identity and metadata objects, the map) against reading and parsing the
// same 10,000 metadata files raw, each opened by its path. Target: at least
// 0.8x. The map's build opens each file relative to the class directory's
// descriptor; a second raw loop that does the same is reported beside it
// (not judged), so the share of the ratio that comes from the cheaper open
// is visible. Prints the peak resident set size after the build and what it
// grew by.
#include <fcntl.h>
#include <sys/resource.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "VSABenchRatio.h"
#include "base/VSALog.h"
#include "base/VSAPlist.h"
#include "model/VSAContainerCache.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSALinuxPersonaService.h"

namespace fs = std::filesystem;

namespace {
constexpr int kContainers = 10000;

struct Device {
  std::string root;
  std::shared_ptr<VSAGlobalConfiguration> config;
  std::shared_ptr<VSAUserIdentityCache> identities;
  VSAUserIdentityRef user;
  std::vector<std::string> files;
  std::string classDirectory;
  std::vector<std::string> relativeFiles;  // the same files, relative to classDirectory

  Device() {
    char tmpl[] = "/tmp/vessa-bench-cache-XXXXXX";
    root = mkdtemp(tmpl);
    fs::create_directories(root + "/etc");
    fs::create_directories(root + "/private/var/mobile");
    std::ofstream(root + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    VSASystemRoot r(root);
    auto users = std::make_shared<VSAUserDatabase>(r);
    config = std::make_shared<VSAGlobalConfiguration>(
        r, std::make_shared<VSADeviceProperties>(r), users,
        std::make_shared<VSAFileManager>(std::make_shared<VSALinuxFileSystem>(), users));
    identities = VSAUserIdentityCache::create(
        {std::make_shared<VSALinuxPersonaService>(r), users, 501, 501, true, nullptr});
    user = identities->userIdentityForPersonalPersona();
    std::string base =
        *config->containerDirectoryURLForUserIdentity(user, VSAClass::kDataApplication, false);
    classDirectory = base;
    for (int i = 0; i < kContainers; ++i) {
      VSAUUID uuid = VSAUUID::random();
      std::string dir = base + "/" + uuid.string();
      fs::create_directory(dir);
      auto identity = VSAConcreteContainerIdentity::containerIdentityWithUUID(
          VSAUUID::random(), user, "com.bench.app" + std::to_string(i), VSAClass::kDataApplication,
          nullptr);
      VSAMetadata m(identity, std::nullopt, dir, std::nullopt);
      auto bytes = VSAPlist::serialize(m.plist(), VSAPlist::Format::Binary, nullptr);
      files.push_back(dir + "/" + kVSAMetadataFileName);
      relativeFiles.push_back(uuid.string() + "/" + kVSAMetadataFileName);
      std::ofstream(files.back(), std::ios::binary)
          .write(reinterpret_cast<const char*>(bytes->data()), bytes->size());
    }
  }
  ~Device() { fs::remove_all(root); }

  // The cache reads data containers only: no code-signing records and no
  // well-known names are asked for.
  struct NoCodeSigning : VSACodeSigningQueries {
    std::optional<VSAValue> entitlementsForIdentifier(const std::string&) override {
      return std::nullopt;
    }
    bool identifierHasSystemContainer(const std::string&) override { return false; }
    std::optional<std::string> parentIdentifierForChildIdentifier(const std::string&) override {
      return std::nullopt;
    }
  } noCodeSigning;
  struct NoWellknown : VSAWellknownContainers {
    std::optional<std::string> wellknownContainerForId(const std::string&,
                                                       VSAContainerClass) const override {
      return std::nullopt;
    }
    bool isLookupWhitelistedFromCodeSignIdentifier(const std::string&, VSAContainerClass,
                                                   const std::string&) const override {
      return false;
    }
  } noWellknown;
  static std::shared_ptr<VSATestLocks> testLocks() {
    return std::make_shared<VSATestLocks>(std::make_shared<VSALocks>());
  }

  std::shared_ptr<VSAContainerCache> freshCache() {
    return VSAContainerCache::create({identities, config,
                                      std::make_shared<VSASandboxService>(VSASystemRoot(root)),
                                      std::make_shared<VSANotificationCenter>(VSASystemRoot(root)),
                                      testLocks(), &noCodeSigning, &noWellknown});
  }
};

Device& device() {
  static Device d;
  return d;
}

long maxRSSKiB() {
  struct rusage u;
  getrusage(RUSAGE_SELF, &u);
  return u.ru_maxrss;
}

void BM_RawMetadataReads(benchmark::State& state) {
  for (auto _ : state) {
    size_t n = 0;
    for (const auto& f : device().files) {
      auto bytes = VSAReadFile(f, nullptr);
      if (bytes && VSAPlist::parse(*bytes, nullptr)) ++n;
    }
    benchmark::DoNotOptimize(n);
  }
}
BENCHMARK(BM_RawMetadataReads)->Unit(benchmark::kMillisecond);

void BM_RawMetadataReadsRelative(benchmark::State& state) {
  for (auto _ : state) {
    int dir = ::open(device().classDirectory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    size_t n = 0;
    std::vector<uint8_t> bytes;
    for (const auto& f : device().relativeFiles)
      if (VSAReadRegularFileAt(dir, f, kVSADefaultReadFileLimit, &bytes) == 0 &&
          VSAPlist::parse(bytes, nullptr))
        ++n;
    ::close(dir);
    benchmark::DoNotOptimize(n);
  }
}
BENCHMARK(BM_RawMetadataReadsRelative)->Unit(benchmark::kMillisecond);

void BM_BuildClassMap(benchmark::State& state) {
  for (auto _ : state) {
    auto cache = device().freshCache();
    auto all =
        cache->allContainersForUserIdentity(device().user, VSAClass::kDataApplication, {}, nullptr);
    if (!all || all->size() != static_cast<size_t>(kContainers))
      state.SkipWithError("class map incomplete");
  }
}
BENCHMARK(BM_BuildClassMap)->Unit(benchmark::kMillisecond);
}  // namespace

int main(int argc, char** argv) {
  VSALogger::shared().setLevel(kVSALogError);
  device();
  long before = maxRSSKiB();
  {
    auto cache = device().freshCache();
    if (!cache->allContainersForUserIdentity(device().user, VSAClass::kDataApplication, {},
                                             nullptr))
      std::fprintf(stderr, "bench_containercache: the class map could not be built\n");
    std::printf(
        "peak RSS after building one map of %d containers: %ld KiB (grew %ld KiB, %.0f "
        "bytes per container)\n\n",
        kContainers, maxRSSKiB(), maxRSSKiB() - before,
        (maxRSSKiB() - before) * 1024.0 / kContainers);
  }
  return VSARunWithRatios(
      argc, argv,
      {{"BM_BuildClassMap", "BM_RawMetadataReads", 0.8, "class map of 10,000 containers"},
       {"BM_BuildClassMap", "BM_RawMetadataReadsRelative", 0.0,
        "class map (raw reads relative to the dir)"}});
}
