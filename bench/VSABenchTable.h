// One row of bench/run-all's table: every benchmark and vessa-bench scenario
// appends its measures, as tab-separated lines, to the file named by
// VSA_BENCH_TABLE (nothing happens when it is not set). A target of 0 marks a
// figure that is reported, not judged.
#pragma once

#include <cstdio>
#include <cstdlib>

inline void VSABenchRecord(const char* measure, const char* baseline, double ratio, double target) {
  const char* path = std::getenv("VSA_BENCH_TABLE");
  if (!path || !*path) return;
  if (FILE* f = std::fopen(path, "a")) {
    std::fprintf(f, "%s\t%s\t%.2f\t%.2f\n", measure, baseline, ratio, target);
    std::fclose(f);
  }
}

// A peak or current memory figure of the table's memory section, in KiB.
inline void VSABenchRecordRSS(const char* what, long kib) {
  const char* path = std::getenv("VSA_BENCH_TABLE");
  if (!path || !*path) return;
  if (FILE* f = std::fopen(path, "a")) {
    std::fprintf(f, "RSS\t%s\t%ld\n", what, kib);
    std::fclose(f);
  }
}
