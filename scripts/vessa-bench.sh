#!/usr/bin/env bash
# Runs vessa-bench against a fresh demo device: provisions a system root,
# registers vessa-bench as a full client and as the kernel bridge, starts
# vessad, runs the six scenarios and the app launch (vessa-launch, installed
# by provisioning) and stops the daemon.
#   scripts/vessa-bench.sh [DIR]
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/device.sh
device_prepare vessa-bench "${1:-}" >/dev/null
cp "$build/vessa-bench" "$build/vessa-floor" "$root/usr/bin/"
cat > "$root/etc/vessad/clients.d/vessa-bench.plist" <<'PL'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>Executable</key><string>/usr/bin/vessa-bench</string>
  <key>SigningIdentifier</key><string>com.tamsk.vessa-bench</string>
  <key>Entitlements</key><dict><key>com.tamsk.private.Vessa.allowed</key><true/></dict>
  <key>KernelBridge</key><true/>
</dict></plist>
PL
chmod 0644 "$root/etc/vessad/clients.d/vessa-bench.plist"
device_start_daemon 3
bench="$root/usr/bin/vessa-bench"
# The latency scenarios run twice: as the scheduler places them, and with the
# client, the floor and the daemon pinned to one CPU (cross-CPU wake-ups cost
# tens of microseconds on a VM and would hide the work of a request).
echo "== Look-up of an existing container, one client"
"$bench" --root "$root" --mode lookup --clients 1 --requests "${LOOKUPS:-20000}"
echo
echo "== Look-up of an existing container, one client, all on CPU 0"
"$bench" --root "$root" --mode lookup --clients 1 --requests "${LOOKUPS:-20000}" --pin 0
echo
echo "== Look-ups of an existing container, 16 clients"
"$bench" --root "$root" --mode lookup --clients 16 --requests "$(( ${LOOKUPS:-20000} / 16 ))"
echo
echo "== Look-ups of an existing container, 16 clients, all on CPU 0"
"$bench" --root "$root" --mode lookup --clients 16 --requests "$(( ${LOOKUPS:-20000} / 16 ))" --pin 0
echo
echo "== Creation, one client"
"$bench" --root "$root" --mode create --clients 1 --requests "${CREATES:-2000}"
echo
echo "== Mixed requests, 16 clients"
"$bench" --root "$root" --mode mixed --clients 16 --requests "${MIXED:-1000}"
echo
echo "== Kernel upcall: an app with a data and two group containers, one client"
"$bench" --root "$root" --mode upcall --clients 1 --requests "${UPCALLS:-20000}"
echo
echo "== Kernel upcall, one client, all on CPU 0"
"$bench" --root "$root" --mode upcall --clients 1 --requests "${UPCALLS:-20000}" --pin 0
echo
echo "== Memory: ${CONTAINERS:-10000} containers cached, 100 idle connections, look-up soak"
"$bench" --root "$root" --mode memory --containers "${CONTAINERS:-10000}" --idle 100 \
  --clients 16 --requests "$(( ${SOAK:-100000} / 16 ))" ||
  echo "vessa-bench: the memory scenario had errors (see above)"
echo
echo "== App launch: vessa-launch of /bin/true against /bin/true started directly"
# The app is installed as an installer leaves one: its bundle container made
# and its code signing registered with its data container class.
# (com.example.bench-launch, and the sixteen launched at once.)
for app in com.example.bench-launch com.example.bench-launch.{0..15}; do
  "$root/usr/bin/demo-installer" --root "$root" create "$app" --class bundle >/dev/null
  "$root/usr/bin/demo-installer" --root "$root" cs set "$app" '{}' \
    '{"com.tamsk.Vessa.DataContainerClass": 2}' >/dev/null
done
"$build/bench/bench_launch" "$root" "$root/usr/bin/vessa-launch" "${LAUNCHES:-200}" ||
  echo "vessa-bench: the launch scenario failed (see above)"
# How often the daemon wakes with nothing to do: every thread's voluntary
# context switches over a few seconds with no client, per minute.
wakeups() { cat /proc/"$daemon"/task/*/status | awk '/^voluntary_ctxt_switches/ { n += $2 } END { print n }'; }
sleep 1
idle_seconds=${IDLE_SECONDS:-10}
before=$(wakeups); sleep "$idle_seconds"; after=$(wakeups)
per_minute=$(( (after - before) * 60 / idle_seconds ))
echo
echo "== Idle: vessad woke $((after - before)) times in ${idle_seconds} s with no client ($per_minute per minute)"
[[ -n "${VSA_BENCH_TABLE:-}" ]] &&
  printf 'IDLE\tvessad wake-ups per minute with no client\t%s\n' "$per_minute" >>"$VSA_BENCH_TABLE"
# The daemon's peak memory over the whole run (for bench/run-all's table).
peak=$(sed -n 's/^VmHWM:[[:space:]]*\([0-9]*\) kB/\1/p' "/proc/$daemon/status")
echo
echo "vessad peak RSS over these runs: ${peak:-?} KiB"
[[ -n "${VSA_BENCH_TABLE:-}" && -n "$peak" ]] &&
  printf 'RSS\tvessad over the vessa-bench scenarios\t%s\n' "$peak" >>"$VSA_BENCH_TABLE"
device_stop_daemon
