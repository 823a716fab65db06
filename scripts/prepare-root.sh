#!/usr/bin/env bash
# Prepares a development root for quorvad: its own accounts (mobile 501, the
# installer 33, the group systemusers), an os-release that marks an internal
# build, the lock-state file, and a trust-store entry that lets the given
# quorvactl act as a privileged client.
#
# usage: scripts/prepare-root.sh ROOT [QUORVACTL]
set -euo pipefail

root=${1:?usage: prepare-root.sh ROOT [QUORVACTL]}
quorvactl=${2:-}
mkdir -p "$root"
root=$(cd "$root" && pwd)

mkdir -p "$root/etc/quorva/clients.d" "$root/run/quorva" "$root/private/var/root" \
         "$root/private/var/mobile" "$root/private/var/containers"

cat > "$root/etc/passwd" <<'PASSWD'
root:x:0:0:root:/private/var/root:/bin/sh
installer:x:33:33:Installer:/private/var/installer:/usr/sbin/nologin
mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh
PASSWD
cat > "$root/etc/group" <<'GROUP'
root:x:0:
installer:x:33:
systemusers:x:95:mobile
mobile:x:501:
GROUP
cat > "$root/etc/os-release" <<'OSRELEASE'
NAME="quorvad development root"
ID=quorvad-dev
VARIANT_ID=internal
BUILD_ID=dev
OSRELEASE
[ -f "$root/run/quorva/lockstate" ] || echo 0 > "$root/run/quorva/lockstate"

if [ -n "$quorvactl" ]; then
  quorvactl=$(readlink -f "$quorvactl")
  cat > "$root/etc/quorva/clients.d/quorvactl.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist PUBLIC "-//Apple//DTD PLIST 1.0//EN" "http://www.apple.com/DTDs/PropertyList-1.0.dtd">
<plist version="1.0">
<dict>
  <key>SigningIdentifier</key><string>com.kelva.quorvactl</string>
  <key>Executable</key><string>$quorvactl</string>
  <key>Entitlements</key>
  <dict>
    <key>com.kelva.private.Quorva.allowed</key><true/>
    <key>com.kelva.private.Quorva.testability</key><true/>
    <key>com.kelva.private.Quorva.userManagedAssets</key><true/>
    <key>com.kelva.private.Quorva.dataMigration</key><true/>
    <key>com.kelva.private.Quorva.stageSharedContent</key><true/>
  </dict>
</dict>
</plist>
PLIST
fi
echo "$root"
