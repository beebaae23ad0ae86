#!/usr/bin/env bash
# Builds vessad and runs every test (unit and end-to-end) with CTest.
#   scripts/test.sh              the normal build
#   scripts/test.sh address      an ASan+UBSan build in build-address/
#   scripts/test.sh thread       a TSan build in build-thread/
# The normal run first gives every fuzz target a few seconds (its own clang
# build in build-fuzz/; VESSA_FUZZ_SMOKE=0 leaves that out), builds and
# checks the Debian package (scripts/package.sh) and runs the benchmarks
# once with small counts (bench/run-all --quick, which prints its table and
# judges nothing; VESSA_BENCH_SMOKE=0 leaves it out).
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
flavour=${1:-}
if [[ -n "$flavour" ]]; then
  export BUILD_DIR=build-$flavour CC=clang-14 CXX=clang++-14
  scripts/build.sh -DVESSA_SANITIZE="$flavour"
else
  scripts/build.sh
fi
if [[ -z "$flavour" && "${VESSA_FUZZ_SMOKE:-1}" != 0 ]]; then
  (unset BUILD_DIR CC CXX && scripts/fuzz.sh --smoke 3)
fi
[[ -n "$flavour" ]] || scripts/package.sh
if [[ -z "$flavour" && "${VESSA_BENCH_SMOKE:-1}" != 0 ]]; then
  bench/run-all --quick
fi
cd "${BUILD_DIR:-build}"
ctest --output-on-failure --timeout 300 -j"$(nproc)"
