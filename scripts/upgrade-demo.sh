#!/usr/bin/env bash
# An old device upgraded, end to end: provisions a demo root as an earlier
# release left it (legacy entitlements file, a marker file, code-signing
# info cached in a bundle container's metadata, group identifiers in a data
# container's metadata, old log files, the old bundle location, an older
# system version), starts vessad as after a boot on the new build, runs the
# client-requested migrations (24, 30), and shows the disk before and after.
#   scripts/upgrade-demo.sh [DIR]
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/device.sh
echo "== Provisioning a demo device"
device_prepare vessa-upgrade "${1:-}"

step() { echo; echo "== $*"; }
ctl() { echo "\$ $*" | sed -e "s|$root|\$ROOT|g" -e "s|$build/||"; "$@" || true; }
show() { sed "s|$root|\$ROOT|g"; }
installer="$root/usr/bin/demo-installer"
library="$root/private/var/root/Library/Vessa"
version() {
  cat > "$root/etc/vessad/system-version.plist" <<PL
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>BuildVersion</key><string>$1</string><key>ReleaseType</key><string>User</string>
</dict></plist>
PL
}

step "The old release (build OLD1) keeps code-signing info in container metadata"
version OLD1
device_start_daemon 5
ctl "$installer" --root "$root" Command=0 Identifier=com.example.old ContainerClass=1 CreateIfNecessary=true
ctl "$installer" --root "$root" Command=5 Identifier=com.example.old ContainerClass=1 \
  Key=com.tamsk.Ferrox.CachedCodeSigningInfo \
  'Value:json={"Entitlements": {"com.tamsk.security.application-groups": ["group.com.example.shared"]}}'
ctl "$installer" --root "$root" Command=0 Identifier=com.example.grouped ContainerClass=2 CreateIfNecessary=true
ctl "$installer" --root "$root" Command=5 Identifier=com.example.grouped ContainerClass=2 \
  Key=com.tamsk.Ferrox.GroupContainerIDs 'Value:json=["group.com.example.shared"]'
device_stop_daemon

step "... and left these files behind (what an earlier release wrote)"
cat > "$library/vsa_entitlements.plist" <<'PL'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>com.example.legacy</key><dict><key>com.tamsk.security.application-groups</key>
    <array><string>group.com.example.shared</string></array></dict>
  <key>com.tamsk.Vessa.ChildPluginBundleIDs</key><dict><key>com.example.legacy</key>
    <array><string>com.example.legacy.widget</string></array></dict>
  <key>com.tamsk.Vessa.PlaceholderEntitlements</key><dict/>
  <key>com.tamsk.Vessa.EntitlementsRegisteredByCaller</key><dict/>
</dict></plist>
PL
cat > "$library/vsa_bundle_migration_complete.plist" <<'PL'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>VSAMigrationVersionNumber</key><string>OLD0</string></dict></plist>
PL
rm -f "$library/vsa_migration_status.plist"  # the marker-file era
mkdir -p "$root/private/var/mobile/Library/Logs/Vessa"
for f in vessad.log vessad.log.1 vessad.log.9; do echo "old $f" > "$root/private/var/mobile/Library/Logs/Vessa/$f"; done
mkdir -p "$root/private/var/mobile/Containers/Bundle/Application/OLD-APP"
echo "old app" > "$root/private/var/mobile/Containers/Bundle/Application/OLD-APP/Info.plist"
before=$(cd "$root" && find private/var/mobile/Library/Logs private/var/mobile/Containers/Bundle \
  private/var/root/Library/Vessa -maxdepth 3 | sort)
echo "$before" | sed 's/^/  /'

step "The device boots build NEW2: vessad --after-boot runs the build-upgrade migration"
version NEW2
rm -f "$root/run/vessad/com.tamsk.vessad.upcall"
"$build/vessad" --root "$root" --stderr --log-level 5 --after-boot >"$root/vessad.out" 2>&1 &
daemon=$!
trap 'kill $daemon 2>/dev/null || true' EXIT
for _ in $(seq 100); do [[ -S "$root/run/vessad/com.tamsk.vessad.upcall" ]] && break; sleep 0.05; done
grep -E "Detected upgrade|Migrated log files|Moving bundle containers|Saved last build|Migrating from many" \
  "$root/vessad.out" | sed 's/^.*\] /  /'

step "An installer asks for the data migration (command 24): ACLs, bundle owners, code signing"
ctl "$installer" --root "$root" Command=24
grep -E "Performing|Migrating|Migration completed|Legacy entitlement" "$root/vessad.out" |
  grep -v -E "Detected upgrade|Migrating from many" | sed 's/^.*\] /  /'
ctl "$installer" --root "$root" --json Command=19 Identifier=com.example.old
ctl "$installer" --root "$root" --json Command=19 Identifier=com.example.legacy
step "The per-user migration (command 30): default sub-directories once, protection classes"
ctl "$installer" --root "$root" Command=30

step "The disk after the upgrade"
(cd "$root" && find private/var/mobile/Library/Logs private/var/mobile/Containers/Bundle \
  private/var/containers/Bundle/Application private/var/root/Library/Logs/Vessa \
  private/var/root/Library/Vessa -maxdepth 2 2>/dev/null || true) | sort | sed 's/^/  /'
echo "(legacy entitlements file and marker gone; logs renamed vessad.0, vessad.1; vessad.log.9"
echo " is beyond the log writer's three files; the old app moved to the system bundle location)"
device_stop_daemon

step "The next boot on the same build: nothing to migrate"
rm -f "$root/run/vessad/com.tamsk.vessad.upcall"
"$build/vessad" --root "$root" --stderr --log-level 5 --after-boot >"$root/vessad.out" 2>&1 &
daemon=$!
for _ in $(seq 100); do [[ -S "$root/run/vessad/com.tamsk.vessad.upcall" ]] && break; sleep 0.05; done
grep -o "Current build version.*skipping upgrade" "$root/vessad.out" | sed 's/^/  /'
device_stop_daemon && echo "vessad exited with status 0"
