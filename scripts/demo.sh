#!/usr/bin/env bash
# The daemon's main job on a demo device: provisions a system root (in DIR,
# or a temporary directory), starts vessad on it, sends requests with
# vessactl, shows the replies, and stops the daemon cleanly.
#   scripts/demo.sh [DIR]
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/device.sh
echo "== Provisioning a demo device"
device_prepare vessa-demo "${1:-}"

step() { echo; echo "== $*"; }
ctl() { echo "\$ $*" | sed -e "s|$root|\$ROOT|g" -e "s|$build/||"; "$@" || true; }

step "Starting vessad --root \$ROOT"
device_start_daemon 7
installer="$root/usr/bin/demo-installer"

step "An entitled client sends the retired command 27: the table answers 49"
ctl "$installer" --root "$root" Command=27
step "Command 40 is outside the 33-entry table: 49"
ctl "$installer" --root "$root" --json Command=40
step "An unregistered client is not entitled to command 27: 55"
ctl "$build/vessactl" --root "$root" Command=27
step "A request without a Command key: 49"
ctl "$installer" --root "$root" Identifier=com.example.demo
step "An identifier that would leave its directory is refused at the door: 11"
ctl "$installer" --root "$root" Command=0 Identifier=../../../etc ContainerClass=2 CreateIfNecessary=true

step "Personas the installer may use (it is listed by the universal persona, so all of them)"
ctl "$installer" --root "$root" personas

step "Recording code-signing information for an app (cs set = command 18) and reading it back (cs get = 19)"
ctl "$installer" --root "$root" cs set com.example.demo '{"com.tamsk.Vessa.Entitlements":
  {"com.tamsk.security.application-groups": ["group.com.example.shared"]},
  "TeamIdentifier": "DEMOTEAM"}'
ctl "$installer" --root "$root" --json cs get com.example.demo

step "Creating the app's data container (verb create = command 0, class data = 2)"
ctl "$installer" --root "$root" create com.example.demo --class data
path=$("$installer" --root "$root" --json lookup com.example.demo --class data |
  sed -n 's/.*"ReplyPath": *"\([^"]*\)".*/\1/p')
echo "(asked again, the same container answers with ReplyExisted true)"
step "A container that does not exist: lookup never creates; the code is named (exit 1)"
ctl "$installer" --root "$root" lookup com.example.missing
step "Its directory tree (mode, owner, path)"
find "$path" -printf '%M %u %p\n' | sed -e "s|$root|\$ROOT|g" | sort -k3
step "Its metadata (verb show = command 7; the same request as raw keys: Command=7 ...)"
ctl "$installer" --root "$root" show com.example.demo

step "An info value in its metadata (info set/get = commands 5 and 6); an unset key answers 24"
ctl "$installer" --root "$root" info set com.example.demo com.example.note hello
ctl "$installer" --root "$root" info get com.example.demo com.example.note
ctl "$installer" --root "$root" info get com.example.demo unset
step "The data containers (ls = command 1) and this one's size (usage = command 23)"
ctl "$installer" --root "$root" ls --class data
ctl "$installer" --root "$root" usage com.example.demo

step "Wiping its content (wipe = command 12): same path, same UUID, the files are gone"
echo "secret" > "$path/Documents/diary.txt"
uuid_of() { "$installer" --root "$root" lookup com.example.demo | sed -n 's/^UUID: *//p'; }
before=$(uuid_of)
echo "before: $(ls "$path/Documents")  UUID $before"
ctl "$installer" --root "$root" wipe com.example.demo
after=$(uuid_of)
echo "after:  Documents holds $(ls -A "$path/Documents" | wc -l) entries  UUID $after"
if [ -n "$before" ] && [ "$before" = "$after" ]; then
  echo "(the UUID and the path $(echo "$path" | sed "s|$root|\$ROOT|") are kept)"
else
  echo "(the UUID changed: $before -> $after)"
fi

step "Two apps share a group container (cs set = command 18; group paths: command 16, raw keys)"
shared='{"com.tamsk.Vessa.Entitlements":
  {"com.tamsk.security.application-groups": ["group.com.example.shared"]}}'
alone='{"com.tamsk.Vessa.Entitlements": {}}'
ctl "$installer" --root "$root" cs set com.example.second "$shared"
ctl "$installer" --root "$root" --json Command=16 Identifier=com.example.demo ContainerClass=7
group=$("$installer" --root "$root" --json Command=16 Identifier=com.example.second \
  ContainerClass=7 | sed -n 's/.*"group.com.example.shared": *"\([^"]*\)".*/\1/p')
step "The first app drops the group: one reference is left, the container stays"
ctl "$installer" --root "$root" cs set com.example.demo "$alone"
[ -d "$group" ] && echo "group container still at $(echo "$group" | sed "s|$root|\$ROOT|")"
step "The second app drops it too: the last reference went, the container is staged for deletion"
ctl "$installer" --root "$root" cs set com.example.second "$alone"
if [ -d "$group" ]; then echo "group container still there (unexpected)"; else
  echo "group container gone from its place; death row:"
  ls -A "$root/private/var/root/Library/Caches/com.tamsk.vessad/Dead" | sed 's/^/  /'
fi
echo "the daemon's log, at the first drop (once per user with a home):"
grep -o 'ID: group.com.example.shared is [0-9]*' "$root/vessad.out" |
  sed 's/ID: \(.*\) is \([0-9]*\)/  \1 kept: reference count \2/' || true

step "The kernel launches the app: its containers through the upcall (vessa-upcall, the kernel bridge)"
ctl "$root/usr/bin/vessa-upcall" --root "$root" --signing-id com.example.demo --uid 501 \
  --persona 1000 --group group.com.example.launch --system-group systemgroup.com.example.demo
echo "(a process that is not the kernel bridge is answered with return code 5:)"
cp "$build/vessa-upcall" "$root/tmp/not-the-kernel"
ctl "$root/tmp/not-the-kernel" --root "$root" --signing-id com.example.demo --uid 501 --persona 1000

step "Apps in their containers: vessa-launch runs each as uid 501, confined by Landlock to its own"
launch() { "$root/usr/bin/vessa-launch" --root "$root" --group group.com.example.launch "$@"; }
rule() { launch --signing-id "$1" --print-rules | sed -n "s/.*\"$2\": *\"\([^\"]*\)\".*/\1/p"; }
notes=$(rule com.example.notes Home)
shared=$(rule com.example.notes group.com.example.launch)
echo "(vessa-launch --print-rules prints the containers and the Landlock rules as JSON: ABI $(launch --signing-id com.example.notes --print-rules | sed -n 's/.*"LandlockABI": *\([0-9]*\).*/\1/p'))"
echo "\$ vessa-launch --signing-id com.example.notes --group group.com.example.launch -- sh -c '...'"
launch --signing-id com.example.notes -- sh -c 'echo "my notes" > Documents/notes.txt &&
  echo "hello from notes" > "$1/hello.txt" && echo "  notes runs as uid $(id -u) in its data container; wrote Documents/notes.txt and hello.txt in the group"' sh "$shared" || true
echo "\$ vessa-launch --signing-id com.example.diary --group group.com.example.launch -- sh -c '...'"
launch --signing-id com.example.diary -- sh -c 'cat "$1/Documents/notes.txt" 2>&1 | sed "s|$3|\$ROOT|; s/^/  diary reading notes: /";
  echo "  diary reading the group: $(cat "$2/hello.txt")"' sh "$notes" "$shared" "$root" || true
echo "(without Landlock it would not start the app at all, unless --unconfined; see vessa-launch(8))"

step "User-managed assets (assets = command 28, twice: made, then found; 29 deletes one asset)"
ctl "$installer" --root "$root" assets com.example.demo --create
assets=$("$installer" --root "$root" assets com.example.demo --create | sed -n 's/^Path: *//p')
echo "  (asked again: the same directory, ReplyExisted true)"
echo "la la" > "$assets/song.m4a"
ctl "$installer" --root "$root" Command=29 Identifier=com.example.demo ContainerClass=2 SourcePath=../Documents
ctl "$installer" --root "$root" Command=29 Identifier=com.example.demo ContainerClass=2 SourcePath=song.m4a
echo "assets directory now holds $(ls -A "$assets" | wc -l) entries"

step "Shared content from the app's bundle into its data container (command 26)"
ctl "$installer" --root "$root" create com.example.demo --class bundle
bundle=$("$installer" --root "$root" lookup com.example.demo --class bundle | sed -n 's/^Path: *//p')
mkdir -p "$bundle/Shared"; echo "shared words" > "$bundle/Shared/dictionary.txt"
ctl "$installer" --root "$root" --json Command=26 Identifier=com.example.demo \
  SourcePath=Shared DestPath=Library/Shared
echo "(a path that climbs out is refused with 11:)"
ctl "$installer" --root "$root" Command=26 Identifier=com.example.demo SourcePath=Shared DestPath=../../x

step "Test lock 0 freezes container operations until test-lock (command 31) releases it (internal build)"
ctl "$installer" --root "$root" test-lock 0 on
"$installer" --root "$root" create com.example.frozen > "$root/tmp/frozen.out" &
frozen=$!
sleep 0.5
echo "after 0.5 s the creation has $( [ -s "$root/tmp/frozen.out" ] && echo answered || echo "not answered (frozen)")"
step "While it is frozen, the daemon's state (vessactl status: SIGUSR1, then run/vessad/state.json)"
ctl "$build/vessactl" --root "$root" status
ctl "$installer" --root "$root" test-lock 0 off
wait $frozen || true
echo "released; the creation answered:"; sed 's/^/  /' "$root/tmp/frozen.out"

step "Locking the device, then asking for protection class 1 with retry (protect = command 21)"
ctl "$installer" --root "$root" protect com.example.demo 3
echo 1 > "$root/run/vessad/lockstate"; sleep 0.3
"$installer" --root "$root" --json protect com.example.demo 1 --retry > "$root/tmp/protect.out" &
pending=$!
sleep 0.5
echo "pending update files while locked:"
ls "$root/private/var/root/Library/Vessa/PendingUpdates" | sed 's/^/  /'
echo "unlocking"
echo 0 > "$root/run/vessad/lockstate"
wait $pending || true
echo "the reply, sent when the change finished after the unlock:"
cat "$root/tmp/protect.out"
grep -o 'lock_state_changed: LockState=[0-9]*' "$root/vessad.out"

step "Deleting the container (rm = command 10): it is staged on death row"
ctl "$installer" --root "$root" rm com.example.demo
deathrow="$root/private/var/root/Library/Caches/com.tamsk.vessad/Dead"
ls -A "$deathrow" | sed 's/^/  death row: /'
step "Emptying death row (deathrow empty = command 4)"
ctl "$installer" --root "$root" deathrow empty
echo "death row now holds $(ls -A "$deathrow" | wc -l) entries"
ctl "$installer" --root "$root" lookup com.example.demo

step "Notifications posted by the daemon"
"$build/vessactl" --root "$root" notifications

step "Stopping vessad (SIGTERM)"
device_stop_daemon && echo "vessad exited with status 0"

step "Checking the stopped device's root (vessad --verify: exit 0 clean, 1 findings, 2 unreadable)"
verify() {
  echo "\$ vessad --verify --root \$ROOT $*"
  local status=0
  "$build/vessad" --verify --root "$root" "$@" | sed "s|$root|\$ROOT|g" || status=$?
  echo "exit status $status"
}
verify
step "A stray directory in the data class directory: an orphan the next boot removes (exit 1)"
mkdir -p "$root/private/var/mobile/Containers/Data/Application/not-a-container"
verify --json
rmdir "$root/private/var/mobile/Containers/Data/Application/not-a-container"

step "The daemon's rotating log: $root/private/var/root/Library/Logs/Vessa/vessad.log"
grep -v '<Debug>' "$root/private/var/root/Library/Logs/Vessa/vessad.log" | tail -n 12
echo "(debug lines, signposts included, are in the same file on this internal build)"
: "$root/private/var/root/Library/Logs/Vessa/vessad.log"

echo
echo "(upgrades: scripts/upgrade-demo.sh shows a device of an earlier release upgraded)"
