#!/usr/bin/env bash
# The demo: lays out a device root in demo-root/ from examples/, starts a private message bus that
# activates the freshly built daemon on demand, and talks to it with tavrixctl.
# usage: scripts/demo.sh BUILD_DIR
set -euo pipefail
build=$(cd "${1:-build}" && pwd)
top=$(cd "$(dirname "$0")/.." && pwd)
root="$top/demo-root"
work=$(mktemp -d /tmp/tavrix-demo-XXXXXX)
ctl="$build/tools/tavrixctl"
. "$top/scripts/private-bus.sh"
trap 'stop_private_bus; rm -rf "$work"' EXIT

step() { printf '\n\033[1m== %s\033[0m\n' "$*"; }
run() { printf '$ %s\n' "$*"; "$@" || true; }

rm -rf "$root"
cp -a "$top/examples/demo-root" "$root"
step "Device root $root"
(cd "$root" && find . -type f | sort | sed 's/^\./   /')

start_private_bus "$work" "$build/src/daemon/tavrixservicesd" "$root" 5
step "Private bus at $DBUS_SYSTEM_BUS_ADDRESS; the daemon is not running yet"

step "Watching notifications while the first call starts the daemon"
"$ctl" watch --count 1 --timeout 15 > "$work/watch.out" &
watcher=$!
sleep 0.3
run "$ctl" supported
wait "$watcher" || true
printf 'notification seen: %s\n' "$(cat "$work/watch.out")"

step "Setting a behavior ID (stored lower-cased)"
run "$ctl" set-id Demo-Carrier
run "$ctl" supported
run "$ctl" value CarrierName
run "$ctl" client-type 1

step "The daemon's preferences on disk"
"$build/tools/tavrix-plist" "$root/var/mobile/Library/Preferences/com.zandor.tavrixservices.plist"

step "A call with the wrong arguments is refused and the daemon keeps serving"
run busctl --address="$DBUS_SYSTEM_BUS_ADDRESS" call com.zandor.tavrixservicesd \
    /com/zandor/tavrixservicesd com.zandor.TXManagerServerInterface SetTavrixID i 5
run "$ctl" supported

step "Waiting for the daemon to leave when idle (10 s launch hold + 5 s grace)"
for _ in $(seq 40); do
    busctl --address="$DBUS_SYSTEM_BUS_ADDRESS" status com.zandor.tavrixservicesd >/dev/null 2>&1 || break
    sleep 0.5
done
busctl --address="$DBUS_SYSTEM_BUS_ADDRESS" list --acquired | grep -q com.zandor.tavrixservicesd \
    && echo "still running" || echo "the daemon has exited"
run "$ctl" supported

step "The daemon's log"
grep -v '^dbus-daemon\[' "$work/daemon.log" | sed 's/^/   /'
