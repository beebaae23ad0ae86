#!/usr/bin/env bash
# Builds the libFuzzer targets with clang-14 (ASan+UBSan) and runs one.
#   scripts/fuzz.sh [TARGET] [SECONDS]     TARGET: frame (default), paths, metadata, plist,
#                                          packbuff or upcall; default 60 s
#     frame     the socket's frame stream and binary property lists
#     paths     safe path resolution below a container
#     metadata  a container's metadata file, read and validated
#     plist     the property-list decoder's byte budget and nesting bound
#     packbuff  a peer's pack-buffer storage: every reader, the dump, re-packing
#     upcall    whole upcall messages and their buffers, served by the upcall server
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
target=${1:-frame}
seconds=${2:-60}
export BUILD_DIR=build-fuzz CC=clang-14 CXX=clang++-14
scripts/build.sh -DVESSA_FUZZ=ON
corpus=$(mktemp -d)
cp tests/fuzz/corpus/"$target"/* "$corpus"/ 2>/dev/null || true
"$BUILD_DIR"/tests/fuzz/fuzz_"$target" -max_total_time="$seconds" -max_len=65536 "$corpus"
