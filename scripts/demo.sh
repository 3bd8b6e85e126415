#!/usr/bin/env bash
# Lays out the demo device root in demo-root/ from examples/ and shows what the daemon sees there.
# usage: scripts/demo.sh BUILD_DIR
set -euo pipefail
build=${1:-build}
top=$(cd "$(dirname "$0")/.." && pwd)
root="$top/demo-root"
rm -rf "$root"
cp -a "$top/examples/demo-root" "$root"
echo "== demo device root: $root"
(cd "$root" && find . -type f | sort | sed 's/^\./   /')
echo
echo "== device table (etc/tavrix/DeviceInfo.plist)"
"$build/tools/tavrix-plist" "$root/etc/tavrix/DeviceInfo.plist"
echo
echo "== the daemon's preferences for the mobile user"
"$build/tools/tavrix-plist" "$root/var/mobile/Library/Preferences/com.zandor.tavrixservices.plist"
