// Writing one change of a large sandbox container table: the service
// appends the change to the table's log; the baseline writes the whole
// table (serialized and renamed into place, unsynced), which is what every
// change cost when the table was kept as one file. Reported, not judged:
// the ratio is the whole table's write over one change's.
//   bench_sandbox [ITEMS [CHANGES]]   (100,000 items, 200 changes)
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "VSABenchTable.h"
#include "base/VSALog.h"
#include "base/VSAPlist.h"
#include "platform/VSASandboxService.h"

namespace {
using Clock = std::chrono::steady_clock;

double median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}
}  // namespace

int main(int argc, char** argv) {
  VSALogger::shared().setLevel(kVSALogError);
  int items = argc > 1 ? std::atoi(argv[1]) : 100000;
  int changes = argc > 2 ? std::atoi(argv[2]) : 200;
  char tmpl[] = "/tmp/vessa-bench-sandbox-XXXXXX";
  std::string root = mkdtemp(tmpl);
  auto path = [](int i) {
    return "/private/var/mobile/Containers/Data/Application/" + std::to_string(100000000 + i);
  };
  std::vector<double> appended, whole;
  {
    VSASandboxService sandbox{VSASystemRoot(root)};
    for (int i = 0; i < items; ++i)
      sandbox.setUserStateItem(501, 1, "com.bench.app" + std::to_string(i),
                               VSAClass::kDataApplication, 1000, path(i));
    sandbox.flush();
    // The same items as one dictionary, the form of the whole table.
    VSAValue::Array list;
    for (int i = 0; i < items; ++i)
      list.push_back(
          VSAValue::Dictionary{{"ItemType", VSAValue(uint64_t{1})},
                               {"Identifier", VSAValue("com.bench.app" + std::to_string(i))},
                               {"Class", VSAValue(uint64_t{2})},
                               {"PersonaID", VSAValue(int64_t{1000})},
                               {"Path", VSAValue(path(i))}});
    VSAValue table = VSAValue::Dictionary{{"Items", VSAValue(std::move(list))}};
    std::string copy = root + "/whole-table.plist";
    for (int c = 0; c < changes; ++c) {
      auto t0 = Clock::now();
      sandbox.setUserStateItem(501, 1, "com.bench.app" + std::to_string(c % items),
                               VSAClass::kDataApplication, 1000, path(c) + "-moved");
      sandbox.flush();
      auto t1 = Clock::now();
      appended.push_back(std::chrono::duration<double, std::milli>(t1 - t0).count());
      if (c % 20 == 0) {  // the whole table is slow: a tenth as many samples
        auto w0 = Clock::now();
        auto bytes = VSAPlist::serialize(table, VSAPlist::Format::Binary, nullptr);
        VSAWriteFileAtomically(copy, *bytes, 0644, nullptr, false);
        whole.push_back(std::chrono::duration<double, std::milli>(Clock::now() - w0).count());
      }
    }
  }
  double a = median(appended), w = median(whole);
  std::printf(
      "sandbox table of %d items, %d changes: one change written %.3f ms (median), "
      "the whole table %.1f ms (median of %zu)\n",
      items, changes, a, w, whole.size());
  std::printf("ratio (whole table / one change): %.0fx (reported)\n", w / a);
  VSABenchRecord("sandbox table: one change written", "the whole table written", w / a, 0.0);
  std::filesystem::remove_all(root);
  return 0;
}
