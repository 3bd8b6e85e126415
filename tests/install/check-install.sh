#!/usr/bin/env bash
# Installs the build into a scratch directory and checks what an integrator gets: every file in
# its place under the configured prefix, the service files naming the installed daemon, and the
# user and directory snippets accepted by systemd's own tools.
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

[ -x "$image$daemon" ] || fail "no daemon at $daemon"
for tool in tavrixctl tavrix-catalog tavrix-plist; do
    [ -x "$image$prefix/bin/$tool" ] || fail "no $tool in $prefix/bin"
done
for tool in tavrixctl tavrix-catalog tavrix-plist; do
    "$image$prefix/bin/$tool" --version | grep -q "^$tool [0-9]" || fail "$tool --version"
    "$image$prefix/bin/$tool" -h | grep -q "^usage: $tool" || fail "$tool -h"
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
completion=$(find_one bash-completion/completions/tavrixctl)
bash -n "$completion" || fail "the bash completion does not parse"
sysusers=$(find_one sysusers.d/tavrixservicesd.conf)
tmpfiles=$(find_one tmpfiles.d/tavrixservicesd.conf)

grep -qx "ExecStart=$daemon" "$unit" || fail "the unit does not start $daemon"
grep -qx "Exec=$daemon" "$activation" || fail "the activation file does not name $daemon"
! grep -rq '@[A-Z_]*@' "$unit" "$activation" || fail "a placeholder was left unreplaced"

# The snippets make the mobile user, the tavrix group and every directory the unit writes.
if command -v systemd-sysusers >/dev/null && command -v systemd-tmpfiles >/dev/null; then
    root="$stage/root"
    mkdir -p "$root/etc"
    systemd-sysusers --root="$root" "$sysusers" 2>/dev/null
    grep -q '^mobile:x:[0-9]*:[0-9]*:[^:]*:/var/mobile:' "$root/etc/passwd" || fail "no mobile user"
    grep -q '^tavrix:' "$root/etc/group" || fail "no tavrix group"
    systemd-tmpfiles --root="$root" --create "$tmpfiles" 2>/dev/null
    for directory in var/mobile/Library/Preferences var/mobile/Library/TavrixBundles \
        var/lib/tavrixservicesd var/cache/tavrixservicesd; do
        [ -d "$root/$directory" ] || fail "tmpfiles.d does not make /$directory"
    done
else
    echo "systemd-sysusers or systemd-tmpfiles missing: snippets not checked"
fi
echo "installed under $prefix: all files in place"
