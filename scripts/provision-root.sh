#!/usr/bin/env bash
# Lays out a demo device under a system root:
#   scripts/provision-root.sh ROOT VESSACTL [CLIENT_USER]
# First `vessactl provision`, which writes what every root needs (the mobile
# user 501, a personal persona, device properties, the system version, and
# the client registry: vessactl as root's full client, vessa-upcall and
# vessa-launch as the kernel bridge when they sit beside VESSACTL). Then what
# the demo adds on top:
# - etc/vessad/device.plist of an internal build, so debug lines reach the log
#   and the test locks work;
# - etc/vessad/personas.plist: a personal, an enterprise and a universal persona;
# - a registered client "demo-installer" (a copy of vessactl holding the
#   full-client entitlement) in /usr/bin and /etc/vessad/clients.d; with
#   CLIENT_USER (a uid or a user name of the device), its entry carries "User"
#   and it is recognised only when run as that user (root otherwise).
# The executables and their directory are root-owned and writable by root
# only: the daemon refuses registry entries whose program others could rewrite.
set -euo pipefail
root=$1
vessactl=$2
client_user=${3:-}
mkdir -p "$root"
"$vessactl" --root "$root" provision >/dev/null
cat > "$root/etc/vessad/device.plist" <<'PL'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>HasInternalContent</key><true/>
</dict></plist>
PL
cat > "$root/etc/vessad/personas.plist" <<'PL'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><array>
  <dict><key>PersonaID</key><integer>1000</integer><key>Kind</key><string>personal</string>
        <key>UniqueString</key><string>PERSONAL-1000</string></dict>
  <dict><key>PersonaID</key><integer>1001</integer><key>Kind</key><string>enterprise</string>
        <key>UniqueString</key><string>WORK-1001</string>
        <key>LayoutPath</key><string>/private/var/enterprise/1001</string>
        <key>BundleIdentifiers</key><array><string>com.example.work</string></array></dict>
  <dict><key>PersonaID</key><integer>1002</integer><key>Kind</key><string>universal</string>
        <key>UniqueString</key><string>SHARED-1002</string>
        <key>BundleIdentifiers</key><array><string>com.tamsk.demo.installer</string></array></dict>
</array></plist>
PL
mkdir -p "$root/private/var/enterprise/1001"
cp "$vessactl" "$root/usr/bin/demo-installer"
chown 0:0 "$root/usr/bin" "$root/usr/bin/demo-installer"
chmod 0755 "$root/usr/bin" "$root/usr/bin/demo-installer"
user_key=
if [[ -n $client_user ]]; then
  if [[ $client_user =~ ^[0-9]+$ ]]; then
    user_key="  <key>User</key><integer>$client_user</integer>"
  else
    user_key="  <key>User</key><string>$client_user</string>"
  fi
fi
cat > "$root/etc/vessad/clients.d/demo-installer.plist" <<PL
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>Executable</key><string>/usr/bin/demo-installer</string>
  <key>SigningIdentifier</key><string>com.tamsk.demo.installer</string>
  <key>Entitlements</key><dict>
    <key>com.tamsk.private.Vessa.allowed</key><true/>
    <key>com.tamsk.private.Vessa.userManagedAssets</key><true/>
    <key>com.tamsk.private.Vessa.deleteContainerContent</key><true/>
    <key>com.tamsk.private.Vessa.testability</key><true/>
  </dict>
  <key>Sandboxed</key><false/>
$user_key
</dict></plist>
PL
chmod 0644 "$root"/etc/vessad/clients.d/*.plist
echo "provisioned $root"
