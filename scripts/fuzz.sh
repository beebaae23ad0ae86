#!/usr/bin/env bash
# Builds the libFuzzer targets with clang-14 (ASan+UBSan) and runs one, or
# every one for a few seconds.
#   scripts/fuzz.sh [TARGET] [SECONDS]     TARGET: one of the names below; default frame, 60 s
#   scripts/fuzz.sh --runs N TARGET        exactly N executions (the long runs: N = 10000000)
#   scripts/fuzz.sh --smoke [SECONDS]      every target from its seeds, SECONDS each (default 3)
#     frame       the socket's frame stream and binary property lists
#     paths       safe path resolution below a container
#     metadata    a container's metadata file, read and validated
#     plist       the property-list decoder's byte budget and nesting bound
#     packbuff    a peer's pack-buffer storage: every reader, the dump, re-packing
#     upcall      whole upcall messages and their buffers, served by the upcall server
#     replacefile a replace operation's journal
#     updatefile  a pending protection change's update file
#     statusfile  the migration status file with the system-version file
#     registry    one client registry entry
#     personas    the persona list file
set -euo pipefail
cd "$(dirname "$0")/.."
targets=(frame paths metadata plist packbuff upcall replacefile updatefile statusfile registry
  personas)
scripts/setup.sh
export BUILD_DIR=build-fuzz CC=clang-14 CXX=clang++-14
cmake -S . -B "$BUILD_DIR" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DVESSA_FUZZ=ON >/dev/null
cmake --build "$BUILD_DIR" --parallel "$(nproc)" --target "${targets[@]/#/fuzz_}"

# run TARGET ARGS...: the target over a scratch copy of its seeds; an input
# that finds a fault is kept in build-fuzz/fuzz-findings/.
run() {
  local target=$1
  shift
  local corpus
  corpus=$(mktemp -d)
  cp tests/fuzz/corpus/"$target"/* "$corpus"/ 2>/dev/null || true
  mkdir -p "$BUILD_DIR/fuzz-findings"
  "$BUILD_DIR"/tests/fuzz/fuzz_"$target" -max_len=65536 -artifact_prefix="$BUILD_DIR/fuzz-findings/$target-" "$@" "$corpus"
  rm -rf "$corpus"
}

case "${1:-frame}" in
  --smoke)
    seconds=${2:-3}
    log=$(mktemp)
    for t in "${targets[@]}"; do
      if ! run "$t" -max_total_time="$seconds" -print_final_stats=1 >"$log" 2>&1; then
        tail -n 40 "$log"
        echo "fuzz smoke: $t found a fault"
        exit 1
      fi
      echo "fuzz smoke: $t $(grep -o 'number_of_executed_units: *[0-9]*' "$log" | grep -o '[0-9]*$') runs in ${seconds}s"
    done
    rm -f "$log"
    echo "fuzz smoke: ${#targets[@]} targets, no finding"
    ;;
  --runs)
    run "$3" -runs="$2" -print_final_stats=1
    ;;
  *)
    run "${1:-frame}" -max_total_time="${2:-60}"
    ;;
esac
