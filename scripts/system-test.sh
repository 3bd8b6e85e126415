#!/usr/bin/env bash
# The installed packages on the real system bus, with the installed files only: the bus starts the
# daemon as its own user through activation, the bus policy refuses what it should, a payload is
# set and its notification heard, and a look-alike notification from another user goes nowhere.
# Then the packages are purged and whatever this script created is removed again.
# Run as root on a machine without the packages: scripts/system-test.sh  (not part of make test)
# With --installed (the autopkgtest), the packages installed already are tested and kept.
set -uo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
name=com.zandor.tavrixservicesd
packages=(tavrixservicesd libtavrixclient1 libtavrixclient-dev)
installed=no
[ "${1:-}" = --installed ] && installed=yes

[ "$(id -u)" = 0 ] || { echo "system-test: run as root" >&2; exit 2; }
if [ "$installed" = yes ]; then
    dpkg-query -W -f='${Status}' tavrixservicesd 2>/dev/null | grep -q 'ok installed' ||
        { echo "system-test: --installed, but tavrixservicesd is not installed" >&2; exit 2; }
    packages=()
fi
for package in "${packages[@]}"; do
    if dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q 'ok installed'; then
        echo "system-test: $package is installed already; this test installs and purges it" >&2
        exit 2
    fi
done

work=$(mktemp -d)
chmod 755 "$work"
. "$top/scripts/step-report.sh"
# step DESCRIPTION COMMAND...: runs the command, output kept for the report.
step() {
    local description=$1
    shift
    "$@" >"$work/step.log" 2>&1
    report $? "$description"
}
as_nobody() { setpriv --reuid=nobody --regid=nogroup --clear-groups "$@"; }
bus_call() { busctl --system call org.freedesktop.DBus /org/freedesktop/DBus org.freedesktop.DBus "$@"; }

# What is here before, so that the end removes exactly what the test added.
existed() { [ -e "$1" ] && echo yes || echo no; }
declare -A had
for path in /var/mobile /var/lib/tavrixservicesd /var/cache/tavrixservicesd /run/tavrixservicesd \
    /tmp/behaviorbundle_zipped.tgz /run/dbus; do
    had[$path]=$(existed "$path")
done
had_user_mobile=$(getent passwd mobile >/dev/null && echo yes || echo no)
had_user_daemon=$(getent passwd tavrixservicesd >/dev/null && echo yes || echo no)
had_group_tavrix=$(getent group tavrix >/dev/null && echo yes || echo no)
dpkg-query -W -f='${Package}\n' | sort >"$work/packages.before"

# 1. The packages, built when dist/ has none.
if [ "$installed" = no ]; then
    if ! ls "$top"/dist/tavrixservicesd_*.deb >/dev/null 2>&1; then
        step "build the packages (make deb)" make -C "$top" deb
    fi
    debs=()
    for package in "${packages[@]}"; do
        debs+=("$(ls "$top"/dist/"${package}"_*.deb | tail -n 1)")
    done
    step "install ${packages[*]}" apt-get install -y --no-install-recommends "${debs[@]}"
fi
step "the daemon's user and the mobile user exist" getent passwd tavrixservicesd mobile

# 2. The system bus: the running one, or one started here (no service manager starts it here).
bus_pid=
if bus_call GetId >/dev/null 2>&1; then
    # A running bus notices new policy files by itself; asking makes it certain.
    bus_call ReloadConfig >/dev/null 2>&1 || sleep 1
else
    mkdir -p /run/dbus
    dbus-daemon --system --fork --print-pid >"$work/bus.pid" 2>"$work/bus.log"
    bus_pid=$(head -n 1 "$work/bus.pid")
fi
step "the system bus answers" bus_call GetId

# 3. Activation: the bus's launch helper starts the installed daemon as its own user.
step "root: tavrixctl supported (activates the daemon)" tavrixctl supported
daemon_uid=$(id -u tavrixservicesd 2>/dev/null)
owner_uid() { bus_call GetConnectionUnixUser s "$name" | awk '{print $2}'; }
step "the name is owned by the tavrixservicesd user" test "$(owner_uid)" = "$daemon_uid"

# 4. The policy: questions for anyone, changes for root and the tavrix group only.
step "nobody: tavrixctl supported works" as_nobody tavrixctl supported
set_id_as_nobody() { ! as_nobody tavrixctl set-id x >"$work/step.log" 2>&1 && grep -q AccessDenied "$work/step.log"; }
set_id_as_nobody
report $? "nobody: tavrixctl set-id is refused with AccessDenied"
own_as_nobody() {
    ! as_nobody busctl --system call org.freedesktop.DBus /org/freedesktop/DBus org.freedesktop.DBus \
        RequestName su "$name" 4 >"$work/step.log" 2>&1 && grep -qi 'access denied' "$work/step.log"
}
own_as_nobody
report $? "nobody: cannot queue for the daemon's name"

# 5. A payload set as root, heard by an unprivileged watcher; the mobile user reads the result.
step "tavrixctl pack examples/bundles/Default.bundle" \
    tavrixctl pack "$top/examples/bundles/Default.bundle" -o "$work/Default.bundle.tgz"
as_nobody tavrixctl watch --count 1 --timeout 60 >"$work/watch.out" 2>"$work/watch.err" &
watcher=$!
sleep 0.5
step "root: tavrixctl set-id with the bundle" \
    tavrixctl set-id System-Test --bundle "$work/Default.bundle.tgz"
wait "$watcher"
watched=$?
cp "$work/watch.err" "$work/step.log"
[ "$watched" = 0 ] && grep -qx kTVXBehaviorBundleChangedNotification "$work/watch.out"
report $? "nobody: tavrixctl watch sees kTVXBehaviorBundleChangedNotification"
read_as_mobile() {
    setpriv --reuid=mobile --regid="$(id -g mobile)" --clear-groups \
        cat /var/mobile/Library/Preferences/com.zandor.tavrix.plist
}
step "the mobile user reads the linked carrier file" read_as_mobile
step "the installed bundle belongs to the daemon's user" \
    test "$(stat -c %U /var/mobile/Library/TavrixBundles/Default.bundle)" = tavrixservicesd
status_as_nobody() {
    as_nobody tavrixctl status --json >"$work/step.log" 2>&1 &&
        grep -qE '"Extracted": *true' "$work/step.log"
}
step "nobody: tavrixctl status shows the payload extracted" status_as_nobody

# 6. A look-alike notification from another user never reaches a listener, even one that does
#    not match the sender; the daemon's user gets through.
as_nobody dbus-monitor --system "type='signal',interface='com.zandor.NotificationCenter'" \
    >"$work/monitor.out" 2>&1 &
monitor=$!
sleep 0.5
emit() { busctl --system emit /com/zandor/tavrixservicesd com.zandor.NotificationCenter Posted s "$1"; }
as_nobody bash -c "$(declare -f emit); emit LookAlikeNotification" >"$work/step.log" 2>&1
setpriv --reuid=tavrixservicesd --regid="$(id -g tavrixservicesd)" --clear-groups \
    bash -c "$(declare -f emit); emit DaemonUserMarker" >>"$work/step.log" 2>&1
for _ in $(seq 50); do
    grep -q DaemonUserMarker "$work/monitor.out" && break
    sleep 0.1
done
kill "$monitor" 2>/dev/null
wait "$monitor" 2>/dev/null
cat "$work/monitor.out" >>"$work/step.log"
grep -q DaemonUserMarker "$work/monitor.out" && ! grep -q LookAlikeNotification "$work/monitor.out"
report $? "a look-alike notification from nobody is refused by the bus"

# 7. The daemon leaves on SIGTERM (this script had the bus start it).
daemon_pid=$(bus_call GetConnectionUnixProcessID s "$name" 2>/dev/null | awk '{print $2}')
if [ -n "$daemon_pid" ]; then
    kill -TERM "$daemon_pid"
    for _ in $(seq 100); do
        kill -0 "$daemon_pid" 2>/dev/null || break
        sleep 0.1
    done
fi
! bus_call GetNameOwner s "$name" >"$work/step.log" 2>&1
report $? "the daemon leaves on SIGTERM and releases its name"

# 8. Purge, and put back what was here before (the autopkgtest's testbed keeps its packages).
if [ "$installed" = no ]; then
    step "purge ${packages[*]}" apt-get purge -y "${packages[@]}"
    gone() { ! ls -d /var/lib/tavrixservicesd /var/cache/tavrixservicesd 2>&1; }
    step "the purge removed the daemon's state and cache" gone
    [ "$had_user_daemon" = yes ] || userdel tavrixservicesd 2>/dev/null
    [ "$had_user_mobile" = yes ] || userdel mobile 2>/dev/null
    [ "$had_group_tavrix" = yes ] || groupdel tavrix 2>/dev/null
    for path in "${!had[@]}"; do
        [ "${had[$path]}" = yes ] || [ "$path" = /run/dbus ] || rm -rf "$path"
    done
fi
if [ -n "$bus_pid" ]; then
    kill "$bus_pid" 2>/dev/null
    for _ in $(seq 50); do
        kill -0 "$bus_pid" 2>/dev/null || break
        sleep 0.1
    done
    rm -f /run/dbus/pid /run/dbus/system_bus_socket
    [ "${had[/run/dbus]}" = yes ] || rmdir /run/dbus 2>/dev/null
fi
if [ "$installed" = no ]; then
    dpkg-query -W -f='${Package}\n' | sort >"$work/packages.after"
    diff "$work/packages.before" "$work/packages.after" >"$work/step.log"
    report $? "the machine's package set is as it was"
fi
rm -rf "$work"

echo "system test: $passed passed, $failed failed"
[ "$failed" = 0 ]
