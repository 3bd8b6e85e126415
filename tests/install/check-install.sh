#!/usr/bin/env bash
# Installs the build into a scratch directory and checks what an integrator gets: every file in
# its place under the configured prefix, the service files naming the installed daemon and its
# user, the user and directory snippets accepted by systemd's own tools; and what an application
# developer gets: the example client built with pkg-config against the installed files only, run
# against the installed daemon on a private bus.
# usage: tests/install/check-install.sh BUILD_DIR
set -euo pipefail
build=${1:?build directory}
stage=$(mktemp -d)
trap 'rm -rf "$stage"' EXIT
fail() { echo "FAIL: $*" >&2; exit 1; }

DESTDIR="$stage/image" cmake --install "$build" >/dev/null
prefix=$(sed -n 's/^CMAKE_INSTALL_PREFIX:PATH=//p' "$build/CMakeCache.txt")
image="$stage/image"
daemon="$prefix/libexec/tavrixservicesd"
libdir=$(sed -n 's/^CMAKE_INSTALL_LIBDIR:PATH=//p' "$build/CMakeCache.txt")
case $libdir in /*) ;; *) libdir="$prefix/$libdir" ;; esac
export LD_LIBRARY_PATH="$image$libdir"

[ -x "$image$daemon" ] || fail "no daemon at $daemon"
for tool in tavrixctl tavrix-catalog tavrix-plist; do
    [ -x "$image$prefix/bin/$tool" ] || fail "no $tool in $prefix/bin"
done
for tool in tavrixctl tavrix-catalog tavrix-plist; do
    # Here-strings, not pipes: grep -q leaving early would fail the writer under pipefail.
    grep -q "^$tool [0-9]" <<<"$("$image$prefix/bin/$tool" --version)" || fail "$tool --version"
    grep -q "^usage: $tool" <<<"$("$image$prefix/bin/$tool" -h)" || fail "$tool -h"
done

find_one() {
    local found
    found=$(find "$image" -path "*/$1" | head -1)
    [ -n "$found" ] || fail "$1 not installed"
    echo "$found"
}
unit=$(find_one systemd/system/tavrixservicesd.service)
find_one systemd/system/tavrixservicesd-update.timer >/dev/null
activation=$(find_one dbus-1/system-services/com.zandor.tavrixservicesd.service)
find_one dbus-1/system.d/com.zandor.tavrixservicesd.conf >/dev/null
find_one dbus-1/interfaces/com.zandor.TXManagerServerInterface.xml >/dev/null
for doc in asset-catalog.md dbus-api.md AssetCatalog.plist; do
    find_one "doc/tavrixservicesd/$doc" >/dev/null
done
completion=$(find_one bash-completion/completions/tavrixctl)
bash -n "$completion" || fail "the bash completion does not parse"
sysusers=$(find_one sysusers.d/tavrixservicesd.conf)
tmpfiles=$(find_one tmpfiles.d/tavrixservicesd.conf)

grep -qx "ExecStart=$daemon" "$unit" || fail "the unit does not start $daemon"
grep -qx "Exec=$daemon" "$activation" || fail "the activation file does not name $daemon"
grep -qx "User=tavrixservicesd" "$unit" || fail "the unit does not run as tavrixservicesd"
grep -qx "User=tavrixservicesd" "$activation" || fail "the bus does not start tavrixservicesd's user"
! grep -rq '@[A-Z_]*@' "$unit" "$activation" || fail "a placeholder was left unreplaced"

# The snippets make the daemon's and the mobile user, the tavrix group and every directory the
# unit writes, the mobile ones owned so that the mobile user cannot rearrange them.
if command -v systemd-sysusers >/dev/null && command -v systemd-tmpfiles >/dev/null; then
    root="$stage/root"
    mkdir -p "$root/etc"
    systemd-sysusers --root="$root" "$sysusers" 2>/dev/null
    grep -q '^mobile:x:[0-9]*:[0-9]*:[^:]*:/var/mobile:' "$root/etc/passwd" || fail "no mobile user"
    grep -q '^tavrixservicesd:x:' "$root/etc/passwd" || fail "no tavrixservicesd user"
    grep -q '^tavrix:' "$root/etc/group" || fail "no tavrix group"
    systemd-tmpfiles --root="$root" --create "$tmpfiles" 2>/dev/null
    for directory in var/mobile/Library/Preferences var/mobile/Library/TavrixBundles \
        var/lib/tavrixservicesd var/cache/tavrixservicesd; do
        [ -d "$root/$directory" ] || fail "tmpfiles.d does not make /$directory"
    done
    daemon_uid=$(sed -n 's/^tavrixservicesd:x:\([0-9]*\):.*/\1/p' "$root/etc/passwd")
    mobile_gid=$(sed -n 's/^mobile:x:[0-9]*:\([0-9]*\):.*/\1/p' "$root/etc/passwd")
    [ "$(stat -c %a:%u:%g "$root/var/mobile")" = "1775:0:$mobile_gid" ] ||
        fail "/var/mobile is not root's, sticky and open to the mobile group"
    for directory in var/mobile/Library var/mobile/Library/Preferences; do
        [ "$(stat -c %a:%u:%g "$root/$directory")" = "1775:$daemon_uid:$mobile_gid" ] ||
            fail "/$directory is not the daemon's, sticky and open to the mobile group"
    done
else
    echo "systemd-sysusers or systemd-tmpfiles missing: snippets not checked"
fi
# The client library as an application sees it.
pc="$image$libdir/pkgconfig/tavrixclient.pc"
[ -f "$pc" ] || fail "no tavrixclient.pc"
flags=$(PKG_CONFIG_PATH="$image$libdir/pkgconfig" PKG_CONFIG_SYSROOT_DIR="$image" \
    pkg-config --cflags --libs tavrixclient) || fail "pkg-config does not know tavrixclient"
source_dir=$(sed -n 's/^CMAKE_HOME_DIRECTORY:INTERNAL=//p' "$build/CMakeCache.txt")
# shellcheck disable=SC2086 # the flags are words
c++ -std=c++20 -Wall -Wextra -Werror -o "$stage/client-example" \
    "$source_dir/examples/client/client-example.cpp" $flags ${TAVRIX_EXAMPLE_FLAGS:-} ||
    fail "the example does not build"
grep -q "libtavrixclient.so.1 => $image" <<<"$(ldd "$stage/client-example")" ||
    fail "the example does not use the installed library"
# The sd-event example, which also needs libsystemd's own flags.
# shellcheck disable=SC2086 # the flags are words
c++ -std=c++20 -Wall -Wextra -Werror -o "$stage/follow-status" \
    "$source_dir/examples/client/follow-status.cpp" $flags $(pkg-config --cflags --libs libsystemd) \
    ${TAVRIX_EXAMPLE_FLAGS:-} || fail "the sd-event example does not build"
# Under an older standard the header says what it needs, in one line.
errors=$(c++ -std=c++17 -fsyntax-only "$source_dir/examples/client/client-example.cpp" $flags 2>&1 ||
    true)
grep -q '#error "<tavrix/client/TavrixClient.h> needs C++20' <<<"$errors" ||
    fail "the header does not say it needs C++20: $errors"
if grep -rqE '#include "(platform|util|payload|daemon|bundle|update)/' "$image$prefix/include/tavrix"; then
    fail "an installed header includes an internal one"
fi

# ... and run against the installed daemon, activated by a private bus on the demo device.
if command -v dbus-daemon >/dev/null; then
    # shellcheck source=scripts/private-bus.sh
    . "$source_dir/scripts/private-bus.sh"
    cp -r "$source_dir/examples/demo-root" "$stage/device"
    trap 'stop_private_bus; rm -rf "$stage"' EXIT
    start_private_bus "$stage/bus" "$image$daemon" "$stage/device" 5 || fail "no private bus"
    output=$("$stage/client-example" --address "$DBUS_SYSTEM_BUS_ADDRESS" 2>&1) ||
        fail "the example failed: $output"
    grep -qE "^supported: (yes|no)$" <<<"$output" || fail "the example was not answered: $output"
    grep -qx "notification: TXDaemonStartedNotification" <<<"$output" ||
        fail "the example heard no notification: $output"
    # The sd-event example reads the properties, then hears the change a set makes.
    coproc FOLLOW { "$stage/follow-status" --address "$DBUS_SYSTEM_BUS_ADDRESS" --count 1 2>&1; }
    # Copies: bash forgets the coprocess's variables once it has ended.
    exec {follow_out}<&"${FOLLOW[0]}"
    follow_pid=$FOLLOW_PID
    seen=""
    while read -r -t 30 line <&"$follow_out"; do
        seen+="$line"$'\n'
        [ "$line" = following ] && break
    done
    grep -qx "DaemonVersion=[0-9.]*" <<<"$seen" || fail "follow-status read no properties: $seen"
    "$image$prefix/bin/tavrixctl" --address "$DBUS_SYSTEM_BUS_ADDRESS" set-id follow-demo \
        >/dev/null || fail "tavrixctl set-id"
    changed=""
    while read -r -t 30 line <&"$follow_out"; do
        changed+="$line"$'\n'
    done
    wait "$follow_pid" || fail "follow-status failed: $changed"
    grep -qx "changed: BehaviorID=follow-demo" <<<"$changed" ||
        fail "follow-status heard no change: $changed"
else
    grep -q '^usage: client-example' <<<"$("$stage/client-example" --help)" ||
        fail "client-example --help"
fi
echo "installed under $prefix: all files in place; the example client builds and runs"
