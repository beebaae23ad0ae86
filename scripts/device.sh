# Shared by scripts/demo.sh and scripts/vessa-bench.sh (sourced from the
# repository's root): builds vessad, provisions a demo system root and runs
# the daemon on it.

# device_prepare PREFIX [DIR]: sets up the machine, builds, and sets repo,
# build and root (DIR, or a fresh /tmp/PREFIX-XXXXXX), then provisions root.
device_prepare() {
  repo=$(pwd)
  scripts/setup.sh
  scripts/build.sh >/dev/null
  build=${BUILD_DIR:-build}
  root=${2:-$(mktemp -d "/tmp/$1-XXXXXX")}
  mkdir -p "$root"
  # Like a device's /, the root is open to every user (mktemp makes it 0700):
  # clients of any uid reach the daemon's socket through it.
  chmod 0755 "$root"
  root=$(cd "$root" && pwd)
  scripts/provision-root.sh "$root" "$repo/$build/vessactl"
}

# device_start_daemon LOG_LEVEL: starts vessad on root (output in
# root/vessad.out), sets daemon, and waits for its socket. The daemon is
# killed if the script ends before device_stop_daemon.
device_start_daemon() {
  "$build/vessad" --root "$root" --stderr --log-level "$1" >"$root/vessad.out" 2>&1 &
  daemon=$!
  trap 'kill $daemon 2>/dev/null || true' EXIT
  for _ in $(seq 100); do [[ -S "$root/run/vessad/com.tamsk.vessad" ]] && break; sleep 0.05; done
}

# device_stop_daemon: SIGTERM, then the daemon's exit status.
device_stop_daemon() {
  kill -TERM "$daemon"
  local status=0
  wait "$daemon" || status=$?
  trap - EXIT
  return "$status"
}
