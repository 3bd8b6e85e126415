#!/usr/bin/env bash
# The packages as a device image runs them: a Debian 12 container booted with systemd as PID 1
# (systemd-nspawn), the packages installed with apt inside it, then the unit, its sandbox, bus
# activation, idle exit, the timer, an update from a signed catalog, the journal, Restart= and a
# purge, each checked from inside. One PASS/FAIL line per step, non-zero on any failure.
# Run as root: make boot-test. The base image is cached in $TAVRIX_BOOT_CACHE
# (default /var/cache/tavrix-boot-test); every run boots a fresh copy of it. Status 75: a fetch
# from the mirror kept failing (scripts/fetch-retry.sh), before any step ran.
set -uo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
. "$top/scripts/fetch-retry.sh"
cache=${TAVRIX_BOOT_CACHE:-/var/cache/tavrix-boot-test}
mirror=${TAVRIX_BOOT_MIRROR:-http://deb.debian.org/debian}
# What the packages need at run time and the test uses, so that the container needs no network.
image_packages=systemd,systemd-sysv,dbus,libplist3,libarchive13,libcurl4,libsodium23,libssl3,python3,procps

[ "$(id -u)" = 0 ] || { echo "boot-test: run as root" >&2; exit 2; }
"$top/scripts/install-deps.sh" --boot ||
    { status=$?; echo "boot-test: cannot install systemd-nspawn and debootstrap" >&2; exit "$status"; }
if ! ls "$top"/dist/tavrixservicesd_*.deb >/dev/null 2>&1; then
    make -C "$top" deb >/dev/null || { echo "boot-test: make deb failed" >&2; exit 2; }
fi
if [ ! -e "$cache/bookworm/etc/os-release" ]; then
    mkdir -p "$cache"
    bootstrap() {
        rm -rf "$cache/bookworm.new"
        debootstrap --variant=minbase --include="$image_packages" bookworm "$cache/bookworm.new" \
            "$mirror" >"$cache/debootstrap.log" 2>&1 || { tail -n 5 "$cache/debootstrap.log" >&2; return 1; }
    }
    fetch_retry "debootstrap of the boot image (log: $cache/debootstrap.log)" bootstrap || exit
    mv "$cache/bookworm.new" "$cache/bookworm"
fi

work=$(mktemp -d /var/tmp/tavrix-boot-test.XXXXXX)
image=$work/root
nspawn=
cleanup() {
    if [ -n "$nspawn" ] && kill -0 "$nspawn" 2>/dev/null; then
        kill -TERM "$nspawn" # halts the container
        for _ in $(seq 100); do kill -0 "$nspawn" 2>/dev/null || break; sleep 0.2; done
        kill -KILL "$nspawn" 2>/dev/null
    fi
    rm -rf "$work"
}
trap cleanup EXIT
cp -a "$cache/bookworm" "$image"
mkdir -p "$image/root/test"
for package in tavrixservicesd libtavrixclient1 libtavrixclient-dev; do
    cp "$(ls "$top"/dist/"$package"_*.deb | tail -n 1)" "$image/root/test/"
done
cp -a "$top/examples/bundles/Default.bundle" "$top/examples/demo-root" "$image/root/test/"
# The system test and the autopkgtest run from a copy of the sources with the packages in dist/.
mkdir -p "$image/root/test/src/dist"
cp -a "$top/scripts" "$top/examples" "$top/debian" "$image/root/test/src/"
cp "$image"/root/test/*.deb "$image/root/test/src/dist/"

. "$top/scripts/step-report.sh"
# inside COMMAND...: runs it in the booted container, as a login would.
inside() {
    nsenter --target "$leader" --all -- /usr/bin/env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin HOME=/root \
        LANG=C.UTF-8 "$@"
}
# step DESCRIPTION SHELL-TEXT: runs the text with sh inside the container, output kept for the report.
step() {
    inside /bin/sh -c "$2" >"$work/step.log" 2>&1
    report $? "$1"
}

# 1. Boot, without a network of its own: the catalog is served on the container's 127.0.0.1.
systemd-nspawn --quiet --directory="$image" --register=no --keep-unit --private-network --boot \
    --console=pipe >"$work/console.log" 2>&1 &
nspawn=$!
leader=
for _ in $(seq 100); do
    leader=$(pgrep -P "$nspawn" -x systemd) && break
    sleep 0.1
done
if [ -z "$leader" ]; then
    cp "$work/console.log" "$work/step.log"
    report 1 "boot the container with systemd as PID 1"
    exit 1
fi
step "boot the container with systemd as PID 1" \
    'for i in $(seq 100); do [ -S /run/systemd/private ] && break; sleep 0.2; done
     test "$(cat /proc/1/comm)" = systemd && timeout 120 systemctl is-system-running --wait |
     grep -Ex "running|degraded"'

# 2. The system test installs, tries and purges the packages; then they are installed with apt
#    as an integrator would, and the autopkgtest runs on them.
step "the system test passes (install, the bus policy, a payload, purge)" \
    'cd /root/test/src && scripts/system-test.sh'
step "install the packages with apt" \
    'apt-get install -y --no-install-recommends /root/test/*.deb'
step "the autopkgtest passes" 'cd /root/test/src && debian/tests/system-test'
step "the update timer is enabled and waiting" \
    'systemctl is-enabled tavrixservicesd-update.timer && systemctl is-active tavrixservicesd-update.timer'
# A tablet like the demo's, with its system bundle and bundle support enabled.
step "a tablet's device table, system bundle and preferences; idle exit after 5 s" \
    'mkdir -p /etc/tavrix /System && cp -a /root/test/demo-root/etc/tavrix/DeviceInfo.plist /etc/tavrix/ &&
     cp -a /root/test/demo-root/System/. /System/ &&
     install -o tavrixservicesd -g tavrixservicesd -m 0644 \
         /root/test/demo-root/var/mobile/Library/Preferences/com.zandor.tavrixservices.plist \
         /var/mobile/Library/Preferences/ &&
     mkdir -p /etc/systemd/system/tavrixservicesd.service.d &&
     printf "[Service]\nEnvironment=TAVRIX_IDLE_EXIT_SEC=5\n" \
         >/etc/systemd/system/tavrixservicesd.service.d/idle.conf && systemctl daemon-reload'

# 3. Bus activation through the unit, with its sandbox in force.
step "a call activates tavrixservicesd.service as its own user" \
    'tavrixctl supported && systemctl is-active tavrixservicesd.service &&
     test "$(ps -o user= -p "$(systemctl show -P MainPID tavrixservicesd.service)")" = tavrixservicesd'
step "the live unit's exposure is at most 1.5" \
    'systemd-analyze security tavrixservicesd.service | tail -n 1 | tee /dev/stderr |
     sed -n "s/.*: \([0-9.]*\) .*/\1/p" | awk "{ exit !(\$1 <= 1.5) }"'
step "the daemon runs without capabilities, new privileges or unfiltered system calls" \
    'status=/proc/$(systemctl show -P MainPID tavrixservicesd.service)/status; cat "$status" |
     grep -E "^(CapEff|NoNewPrivs|Seccomp):" &&
     grep -qx "CapEff:.0000000000000000" "$status" && grep -qx "NoNewPrivs:.1" "$status" &&
     grep -qx "Seccomp:.2" "$status"'

# 4. A behavior ID with a packed bundle; the notification, the links.
inside tavrixctl pack /root/test/Default.bundle -o /root/test/Default.tgz >"$work/step.log" 2>&1
inside /bin/sh -c 'setpriv --reuid=nobody --regid=nogroup --clear-groups \
    tavrixctl watch --count 1 --timeout 60 >/root/test/watch.out 2>/dev/null' &
watcher=$!
sleep 1
step "a behavior ID with a packed bundle" 'tavrixctl set-id Boot-Test --bundle /root/test/Default.tgz'
wait "$watcher"
step "the user nobody hears kTVXBehaviorBundleChangedNotification" \
    'cat /root/test/watch.out; grep -qx kTVXBehaviorBundleChangedNotification /root/test/watch.out'
step "the links lead the mobile user to the installed bundle's carrier file" \
    'ls -l /var/mobile/Library/Tavrix.bundle /var/mobile/Library/Preferences/com.zandor.tavrix.plist &&
     readlink -e /var/mobile/Library/Tavrix.bundle | grep -q "^/var/mobile/Library/TavrixBundles/" &&
     setpriv --reuid=mobile --regid=mobile --clear-groups \
         cat /var/mobile/Library/Preferences/com.zandor.tavrix.plist >/dev/null'

# 5. Idle exit, a start by the timer, and re-activation by a call.
deactivated() {
    step "$1" 'for i in $(seq 60); do
        test "$(journalctl -u tavrixservicesd.service -o cat | grep -c "Deactivated successfully")" -ge '"$2"' &&
            ! systemctl -q is-active tavrixservicesd.service && exit 0
        sleep 1
    done; journalctl -u tavrixservicesd.service -n 10 --no-pager; exit 1'
}
deactivated "the idle daemon leaves (Deactivated successfully)" 1
step "the timer starts the service with no client calling" \
    'mkdir -p /etc/systemd/system/tavrixservicesd-update.timer.d &&
     printf "[Timer]\nOnActiveSec=2s\nRandomizedDelaySec=0\n" \
         >/etc/systemd/system/tavrixservicesd-update.timer.d/soon.conf &&
     systemctl daemon-reload && systemctl restart tavrixservicesd-update.timer &&
     for i in $(seq 30); do systemctl -q is-active tavrixservicesd.service && exit 0; sleep 1; done;
     systemctl status --no-pager tavrixservicesd-update.timer; exit 1'
deactivated "the timer's start leaves again when idle" 2
step "a call activates it again" \
    'tavrixctl supported && systemctl is-active tavrixservicesd.service'

# 6. An update from a signed catalog served on 127.0.0.1.
step "publish version 11 in a signed catalog on 127.0.0.1" \
    'cd /root/test && mkdir v11 && cp -a Default.bundle v11/ &&
     sed -i "s|<string>10</string>|<string>11</string>|" v11/Default.bundle/Info.plist &&
     tavrix-catalog keygen signing.key signing.pub &&
     tavrix-catalog publish site --key signing.key --key-id boot v11/Default.bundle --version 11 &&
     { setsid python3 -m http.server --bind 127.0.0.1 --directory site 8080 >http.log 2>&1 & } &&
     for i in $(seq 50); do tavrix-catalog verify http://127.0.0.1:8080/catalog.plist --key boot=signing.pub && break; sleep 0.2; done &&
     cat >/etc/tavrix/AssetCatalog.plist <<EOF
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>AssetTypes</key><dict>
  <key>com.zandor.Grellas.TavrixBundles</key><dict>
    <key>CatalogURL</key><string>http://127.0.0.1:8080/catalog.plist</string>
    <key>TrustedKeys</key><dict><key>boot</key><string>$(cat signing.pub)</string></dict>
  </dict>
</dict></dict></plist>
EOF'
step "check-update installs version 11" \
    'tavrixctl check-update --wait 60 | tee /dev/stderr | grep -q "installed version 11"'

# 7. The journal: the daemon's entries with their priorities and fields.
step "journal entries carry a priority and the behavior ID as a field" \
    'journalctl -t tavrixservicesd TAVRIX_BEHAVIOR_ID=boot-test -o json --no-pager >/root/test/journal.json &&
     python3 -c "
import json, sys
entries = [json.loads(line) for line in open(\"/root/test/journal.json\")]
assert entries, \"no entry with TAVRIX_BEHAVIOR_ID=boot-test\"
priorities = sorted({int(e[\"PRIORITY\"]) for e in entries})
print(len(entries), \"entries, priorities\", priorities)
assert all(0 <= p <= 7 for p in priorities)
assert all(e.get(\"_SYSTEMD_UNIT\") == \"tavrixservicesd.service\" for e in entries)
"'

# 8. A crash is restarted by Restart=on-failure.
step "kill -9 is recovered by Restart=" \
    'tavrixctl supported >/dev/null && pid=$(systemctl show -P MainPID tavrixservicesd.service) &&
     kill -9 "$pid" && for i in $(seq 30); do
         now=$(systemctl show -P MainPID tavrixservicesd.service)
         [ "$now" != 0 ] && [ "$now" != "$pid" ] && systemctl -q is-active tavrixservicesd.service &&
             tavrixctl supported && exit 0
         sleep 0.5
     done; systemctl status --no-pager tavrixservicesd.service; exit 1'

# 9. A purge leaves nothing of the packages behind.
inside /bin/sh -c 'rm -rf /etc/systemd/system/tavrixservicesd.service.d \
    /etc/systemd/system/tavrixservicesd-update.timer.d /etc/tavrix/AssetCatalog.plist'
step "purge the packages" \
    'dpkg -L tavrixservicesd libtavrixclient1 libtavrixclient-dev | sort -u >/root/test/files &&
     apt-get purge -y tavrixservicesd libtavrixclient1 libtavrixclient-dev'
step "nothing of the packages is left" \
    'left=0; while read -r path; do
         [ ! -d "$path" ] && { [ -e "$path" ] || [ -L "$path" ]; } && { echo "left: $path"; left=1; }
     done </root/test/files
     for path in /var/lib/tavrixservicesd /var/cache/tavrixservicesd /run/tavrixservicesd \
         /etc/systemd/system/timers.target.wants/tavrixservicesd-update.timer; do
         [ -e "$path" ] || [ -L "$path" ] && { echo "left: $path"; left=1; }
     done
     systemctl list-units --all --no-legend "tavrixservicesd*" | grep . && left=1
     exit $left'

echo "boot test: $passed passed, $failed failed"
[ "$failed" = 0 ]
