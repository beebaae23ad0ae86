#!/usr/bin/env bash
# Installs the Debian packages vessad needs. Idempotent and quiet when
# everything is already present. Runs as root, or through sudo.
#   scripts/setup.sh [--bench]   (--bench: also gnuplot, for bench/run-all's picture)
set -euo pipefail

packages=(
  build-essential cmake ninja-build pkg-config clang-14 libclang-rt-14-dev
  libsqlite3-dev libplist-dev libacl1-dev libspdlog-dev libfmt-dev libsystemd-dev
  uuid-dev libssl-dev libgtest-dev libgmock-dev libbenchmark-dev acl e2fsprogs time
)
[[ "${1:-}" == "--bench" ]] && packages+=(gnuplot-nox)

missing=()
for p in "${packages[@]}"; do
  status=$(dpkg-query -W -f='${Status}' "$p" 2>/dev/null || true)
  [[ "$status" == "install ok installed" ]] || missing+=("$p")
done
[[ ${#missing[@]} -eq 0 ]] && exit 0

sudo=""
[[ $(id -u) -eq 0 ]] || sudo="sudo"
echo "setup: installing ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -qq
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
