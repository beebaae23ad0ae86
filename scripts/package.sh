#!/usr/bin/env bash
# Builds the Debian package of vessad (build/vessad_*.deb) and checks it:
# unpacked into a scratch root, it holds the daemon, the client, the units,
# the manual pages and the completion, and the daemon it holds runs.
#   scripts/package.sh
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
scripts/build.sh >/dev/null
build=${BUILD_DIR:-build}
(cd "$build" && cpack -G DEB >/dev/null)
deb=$(ls -t "$build"/vessad_*.deb | head -n 1)
echo "package: $deb"
dpkg-deb --info "$deb" | grep -E "Package|Version|Depends"
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
dpkg-deb -x "$deb" "$scratch"
for f in usr/sbin/vessad usr/bin/vessactl usr/bin/vessa-upcall usr/bin/vessa-launch etc/vessad/clients.d \
  usr/lib/systemd/system/vessad.service usr/lib/systemd/system/vessad.socket \
  usr/share/man/man8/vessad.8 usr/share/man/man8/vessactl.8 usr/share/man/man8/vessa-launch.8 \
  usr/share/bash-completion/completions/vessactl; do
  [[ -e "$scratch/$f" ]] || { echo "package: $f is missing"; exit 1; }
done
"$scratch/usr/sbin/vessad" --help >/dev/null
echo "package: every file in place, the packaged vessad runs"
