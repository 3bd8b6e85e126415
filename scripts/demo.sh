#!/usr/bin/env bash
# The demo: lays out a device root in demo-root/ from examples/, starts a private message bus that
# activates the freshly built daemon on demand, and walks through the daemon's main job with
# tavrixctl: a behavior ID set with a packed bundle, the bundle match, the links, the generated
# overlay file, the notification, a repeated call that changes nothing, and an over-the-air
# update from a signed, expiring catalog served on 127.0.0.1.
# usage: scripts/demo.sh BUILD_DIR
set -euo pipefail
build=$(cd "${1:-build}" && pwd)
top=$(cd "$(dirname "$0")/.." && pwd)
root="$top/demo-root"
work=$(mktemp -d /tmp/tavrix-demo-XXXXXX)
ctl="$build/tools/tavrixctl"
plist="$build/tools/tavrix-plist"
home="$root/var/mobile"
catalog_tool="$build/tools/tavrix-catalog"
. "$top/scripts/private-bus.sh"
http_server=
stop_http_server() {
    [ -n "$http_server" ] || return 0
    kill "$http_server" 2>/dev/null || true
    wait "$http_server" 2>/dev/null || true
    http_server=
}
trap 'stop_http_server; stop_private_bus; rm -rf "$work"' EXIT

step() { printf '\n\033[1m== %s\033[0m\n' "$*"; }
run() { printf '$ %s\n' "$*"; "$@" || true; }
# The daemon's log lines since the mark, without the bus's own.
log_since() { tail -n +"$(($1 + 1))" "$work/daemon.log" | grep -v '^dbus-daemon\[' | sed 's/^/   /'; }
log_mark() { wc -l < "$work/daemon.log"; }
show_links() {
    for link in "$home/Library/Tavrix.bundle" "$home/Library/Preferences/com.zandor.tavrix.plist"; do
        printf '   %s -> %s\n' "${link#"$root"}" "$(readlink "$link" | sed "s|^$root||")"
    done
}

rm -rf "$root"
cp -a "$top/examples/demo-root" "$root"
step "Device root $root (a tablet, hardware model DT1, with a system bundle of version 9)"
(cd "$root" && find . -type f | sort | sed 's/^\./   /')

start_private_bus "$work" "$build/src/daemon/tavrixservicesd" "$root" 5
step "Private bus at $DBUS_SYSTEM_BUS_ADDRESS; the first call starts the daemon"
run "$ctl" supported

step "A newer bundle (version 10) packed as a payload"
run "$ctl" pack "$top/examples/bundles/Default.bundle" -o "$work/Default.bundle.tgz"
bsdtar -tvzf "$work/Default.bundle.tgz" | sed 's/^/   /'

step "Setting the behavior ID with the bundle, while tavrixctl watch listens"
"$ctl" watch --count 1 --timeout 20 > "$work/watch.out" 2>/dev/null &
watcher=$!
sleep 0.3
mark=$(log_mark)
run "$ctl" set-id Demo-Carrier --bundle "$work/Default.bundle.tgz"
wait "$watcher" || true
printf 'notification seen by watch: %s\n' "$(cat "$work/watch.out")"

step "What the daemon did"
log_since "$mark"

step "The links in the mobile home"
show_links

step "The generated overlay file (device overlay for DT1, then the behavior overlay)"
for file in "$home"/Library/TavrixBundles/Overlay/*; do
    printf '   %s\n' "${file#"$root"}"
done
"$plist" "$(readlink "$home/Library/Preferences/com.zandor.tavrix.plist")" | sed 's/^/   /'

step "Behavior settings as clients read them"
run "$ctl" value CarrierName
run "$ctl" value DataSettings

step "The same call again changes nothing: no notification, links untouched"
"$ctl" watch --count 1 --timeout 3 > "$work/watch.out" 2>/dev/null &
watcher=$!
sleep 0.3
before=$(stat -c %i "$home/Library/Tavrix.bundle" "$home/Library/Preferences/com.zandor.tavrix.plist")
mark=$(log_mark)
run "$ctl" set-id Demo-Carrier --bundle "$work/Default.bundle.tgz"
wait "$watcher" && echo "unexpected notification: $(cat "$work/watch.out")" || echo "no notification"
log_since "$mark" | grep -E 'Match Result|already exists'
after=$(stat -c %i "$home/Library/Tavrix.bundle" "$home/Library/Preferences/com.zandor.tavrix.plist")
[ "$before" = "$after" ] && echo "links untouched" || echo "links were replaced"

step "A call with the wrong arguments is refused and the daemon keeps serving"
run busctl --address="$DBUS_SYSTEM_BUS_ADDRESS" call com.zandor.tavrixservicesd \
    /com/zandor/tavrixservicesd com.zandor.TXManagerServerInterface SetTavrixID i 5
run "$ctl" supported

step "Over-the-air update from a local catalog"
# The published bundle says version 11 in its own Info.plist too: the version the daemon compares
# after installing is the bundle's, not the catalog's.
mkdir -p "$work/v11"
cp -a "$top/examples/bundles/Default.bundle" "$work/v11/"
sed -i 's|<string>10</string>|<string>11</string>|' "$work/v11/Default.bundle/Info.plist"
run "$catalog_tool" keygen "$work/signing.key" "$work/signing.pub"
run "$catalog_tool" publish "$work/site" --key "$work/signing.key" --key-id demo \
    --expires-in 30 "$work/v11/Default.bundle" --version 11
port=$(python3 -c 'import socket; s = socket.socket(); s.bind(("127.0.0.1", 0)); print(s.getsockname()[1])')
python3 -m http.server --bind 127.0.0.1 --directory "$work/site" "$port" > "$work/http.log" 2>&1 &
http_server=$!
for _ in $(seq 100); do
    curl -s -o /dev/null "http://127.0.0.1:$port/catalog.plist" && break
    sleep 0.05
done
printf 'serving %s at http://127.0.0.1:%s/\n' "$work/site" "$port"
# Checked the way the device will check it: signature, expiry, serial, archive digests.
run "$catalog_tool" verify "http://127.0.0.1:$port/catalog.plist" --key "demo=$work/signing.pub"
cat > "$root/etc/tavrix/AssetCatalog.plist" <<SETTINGS
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">
<dict>
	<key>AssetTypes</key>
	<dict>
		<key>com.zandor.Grellas.TavrixBundles</key>
		<dict>
			<key>CatalogURL</key>
			<string>http://127.0.0.1:$port/catalog.plist</string>
			<key>TrustedKeys</key>
			<dict>
				<key>demo</key>
				<string>$(cat "$work/signing.pub")</string>
			</dict>
		</dict>
	</dict>
</dict>
</plist>
SETTINGS
printf '%s:\n' "/etc/tavrix/AssetCatalog.plist"
"$plist" "$root/etc/tavrix/AssetCatalog.plist" | sed 's/^/   /'
mark=$(log_mark)
run "$ctl" check-update --wait 20

step "What the daemon did for the update"
log_since "$mark" | grep -E 'Current version|Query returned|A higher version|Best Candidate|Asset catalog: (downloading|installed|download of|refusing)|Current operation: (Completed|Failed)|Copying the directory|redoing bundle match|Match Result|purged'

step "The links and the bundle version now linked"
show_links
printf '   linked bundle: %s\n' \
    "$("$plist" "$home/Library/Tavrix.bundle/Info.plist" | grep QZBundleVersion | sed 's/^ *//')"

step "What the daemon reports about itself"
run "$ctl" status
