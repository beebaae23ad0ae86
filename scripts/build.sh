#!/usr/bin/env bash
# Configures and builds vessad into build/ (or $BUILD_DIR). Extra arguments go
# to cmake, e.g. -DVESSA_SANITIZE=address.
set -euo pipefail
cd "$(dirname "$0")/.."
build=${BUILD_DIR:-build}
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=${BUILD_TYPE:-RelWithDebInfo} "$@" >/dev/null
cmake --build "$build" --parallel "$(nproc)"
