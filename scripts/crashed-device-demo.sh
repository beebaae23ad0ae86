#!/usr/bin/env bash
# A device that crashed, brought into order by the next boot: provisions a
# demo root, freezes the daemon inside a wipe (between its two renames) and
# inside a protection change (its update file written, nothing applied yet)
# with test locks, plants what a crash and a restore leave (a staging
# leftover, orphaned directories with and without metadata, system-container
# backups), kills the daemon with SIGKILL, and shows the disk before and
# after a start as the first after a boot.
#   scripts/crashed-device-demo.sh [DIR]
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/device.sh
echo "== Provisioning a demo device"
device_prepare vessa-crashed "${1:-}"

step() { echo; echo "== $*"; }
ctl() { echo "\$ $*" | sed -e "s|$root|\$ROOT|g" -e "s|$build/||"; "$@" >/dev/null || true; }
path_of() {
  "$installer" --root "$root" --json "$@" | sed -n 's/.*"ReplyPath": *"\([^"]*\)".*/\1/p'
}
listing() {
  (cd "$root" && find private/var/mobile/Containers/Data/Application private/var/mobile/Containers/Staging \
    private/var/containers/Data/System private/var/mobile/Library/Backup \
    private/var/root/Library/Vessa/Replace private/var/root/Library/Vessa/PendingUpdates \
    -maxdepth 2 2>/dev/null || true) | grep -v '/Library$\|/Documents$\|/tmp$\|/SystemData$' | sort |
    sed 's/^/  /'
}
installer="$root/usr/bin/demo-installer"
data="$root/private/var/mobile/Containers/Data/Application"

step "A running device: two apps and a system container"
device_start_daemon 5
ctl "$installer" --root "$root" Command=0 Identifier=com.example.wiped ContainerClass=2 CreateIfNecessary=true
ctl "$installer" --root "$root" Command=0 Identifier=com.example.protected ContainerClass=2 CreateIfNecessary=true
ctl "$installer" --root "$root" Command=0 Identifier=com.example.sysd ContainerClass=12 CreateIfNecessary=true
wiped=$(path_of Command=0 Identifier=com.example.wiped ContainerClass=2)
echo "precious" > "$wiped/Documents/notes.txt"

step "Freezing a protection change after its update file, and a wipe between its renames"
ctl "$installer" --root "$root" Command=31 TestLock=5 Enable=true
"$installer" --root "$root" Command=21 Identifier=com.example.protected ContainerClass=2 \
  DataProtectionClass:i64=3 >/dev/null 2>&1 &
sleep 0.3
ctl "$installer" --root "$root" Command=31 TestLock=3 Enable=true
"$installer" --root "$root" Command=12 Identifier=com.example.wiped ContainerClass=2 >/dev/null 2>&1 &
sleep 0.5

step "What else a crash and a restore leave behind"
mkdir -p "$root/private/var/mobile/Containers/Staging/DEAD0000-0000-4000-8000-000000000001/Documents"
mkdir -p "$data/B0A1D000-0000-4000-8000-00000000000A/Documents"   # a UUID without metadata
mkdir -p "$data/not-a-container"                                 # a name no container has
backup="$root/private/var/mobile/Library/Backup/SystemContainers/Data"
mkdir -p "$backup/com.example.sysd" "$backup/com.example.restored/Library"
echo "restored settings" > "$backup/com.example.sysd/settings.plist"
echo "restored prefs" > "$backup/com.example.restored/Library/prefs"

step "SIGKILL while frozen"
kill -KILL "$daemon"; wait "$daemon" 2>/dev/null || true; trap - EXIT
echo "before the next boot:"
listing

step "The next boot (vessad --after-boot): setup, then the cleanups while requests are served"
device_start_daemon_after_boot() {
  rm -f "$root/run/vessad/com.tamsk.vessad" "$root/run/vessad/com.tamsk.vessad.upcall"
  "$build/vessad" --root "$root" --stderr --log-level 5 --after-boot >"$root/vessad.out" 2>&1 &
  daemon=$!
  trap 'kill $daemon 2>/dev/null || true' EXIT
  for _ in $(seq 200); do [[ -S "$root/run/vessad/com.tamsk.vessad.upcall" ]] && break; sleep 0.05; done
}
device_start_daemon_after_boot
for _ in $(seq 100); do
  "$build/vessactl" --root "$root" notifications | grep -q "reboot-cleanup-complete" && break
  sleep 0.1
done
sleep 0.3
grep -E "Restoring|Installing|Deleting orphaned|INTERNAL BUILD REQUEST|moved back|Found pending|replace" \
  "$root/vessad.out" | grep -v "END INTERNAL" | sed -e 's/^.*\] /  /' -e "s|$root|\$ROOT|g" | head -20
echo "after (this internal build keeps the backups, renamed .inprogress, for inspection):"
listing
echo "the wiped app kept its content (the crash came before the second rename):"
cat "$(path_of Command=0 Identifier=com.example.wiped ContainerClass=2)/Documents/notes.txt" | sed 's/^/  /'
echo "the restored system container:"
cat "$(path_of Command=0 Identifier=com.example.sysd ContainerClass=12)/settings.plist" | sed 's/^/  /'
"$build/vessactl" --root "$root" notifications | sed 's/^/  notification: /'
device_stop_daemon && echo "vessad exited with status 0"
