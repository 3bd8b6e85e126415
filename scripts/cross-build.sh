#!/usr/bin/env bash
# Builds the project for another Debian architecture with Debian's cross toolchain and that
# architecture's -dev packages, then runs the tests whose label matches LABEL (default: unit;
# 'unit|integration' for both) under qemu.
# The build runs in a Debian 12 build root (debootstrap, kept in $TAVRIX_CROSS_CACHE, default
# /var/cache/tavrix-cross/ARCH) entered with systemd-nspawn, the checkout bound at its own path:
# the build machine's architectures and packages stay as they are, and the root takes both
# architectures' libraries from the point release (bookworm, bookworm-updates), whose indexes
# are published together; a multiarch library must have one version for both.
# The kernel hands the binaries to qemu (binfmt_misc), so that the tests and the programs they
# start run as on a device, under their own names.
# With --deb, the Debian packages instead (dpkg-buildpackage -a ARCH, nocheck: the tests run in
# the other mode), checked by lintian, into dist/ARCH/.
# usage: scripts/cross-build.sh [--deb] ARCH [LABEL]  (as root; ARCH: arm64 or armhf; build in build-ARCH/)
# Status 75: a fetch from the mirror kept failing (scripts/fetch-retry.sh).
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
cd "$top"
. scripts/fetch-retry.sh
deb=
if [ "${1:-}" = --deb ]; then
    deb=--deb
    shift
fi
arch=${1:?usage: scripts/cross-build.sh [--deb] ARCH [LABEL]}
label=${2:-unit}
jobs=${JOBS:-2}
case "$arch" in
    arm64) emulator=qemu-aarch64 ;;
    armhf) emulator=qemu-arm ;;
    *) echo "cross-build: no cross build for $arch (arm64, armhf)" >&2; exit 2 ;;
esac

if [ "${TAVRIX_IN_BUILD_ROOT:-}" != "$arch" ]; then
    [ "$(id -u)" = 0 ] || { echo "cross-build: run as root" >&2; exit 2; }
    scripts/install-deps.sh "--emulate=$arch"
    [ -e "/proc/sys/fs/binfmt_misc/$emulator" ] ||
        { echo "cross-build: $emulator is not registered with binfmt_misc" >&2; exit 1; }
    root=${TAVRIX_CROSS_CACHE:-/var/cache/tavrix-cross}/$arch
    mirror=${TAVRIX_CROSS_MIRROR:-http://deb.debian.org/debian}
    if [ ! -e "$root/etc/os-release" ]; then
        mkdir -p "$(dirname "$root")"
        bootstrap() {
            rm -rf "$root.new"
            debootstrap --variant=minbase bookworm "$root.new" "$mirror" >"$root.log" 2>&1 ||
                { tail -n 5 "$root.log" >&2; return 1; }
        }
        echo "cross-build: making the build root $root (debootstrap, log in $root.log)"
        fetch_retry "debootstrap of the build root" bootstrap
        printf 'deb %s bookworm main\ndeb %s bookworm-updates main\n' "$mirror" "$mirror" \
            >"$root.new/etc/apt/sources.list"
        mv "$root.new" "$root"
    fi
    # --as-pid2: a stub init reaps what the tests leave behind. The root is locked while in use.
    exec systemd-nspawn --quiet --register=no --keep-unit --as-pid2 --pipe --directory="$root" \
        --bind="$top" --chdir="$top" --setenv=TAVRIX_IN_BUILD_ROOT="$arch" --setenv=JOBS="$jobs" \
        --setenv=TAVRIX_FETCH_TRIES="${TAVRIX_FETCH_TRIES:-4}" \
        --setenv=TAVRIX_FETCH_PAUSE="${TAVRIX_FETCH_PAUSE:-30}" \
        scripts/cross-build.sh $deb "$arch" "$label"
fi

scripts/install-deps.sh "--cross=$arch" $deb
if [ -n "$deb" ]; then
    # dpkg-buildpackage leaves the packages beside the checkout, inside the root.
    rm -f ../*_"$arch".deb ../*_"$arch".changes ../*_"$arch".buildinfo
    DEB_BUILD_OPTIONS="nocheck parallel=$jobs" DEB_BUILD_PROFILES=nocheck \
        dpkg-buildpackage -a "$arch" -B -us -uc
    mkdir -p "dist/$arch"
    mv ../*_"$arch".deb ../*_"$arch".changes ../*_"$arch".buildinfo "dist/$arch/"
    lintian --fail-on error,warning "dist/$arch/"*.deb
    exit
fi
triplet=$(dpkg-architecture -a"$arch" -qDEB_HOST_MULTIARCH 2>/dev/null)
build=build-$arch
if [ ! -f "$build/build.ninja" ]; then
    cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTAVRIX_BENCH=OFF \
        -DCMAKE_SYSTEM_NAME=Linux -DCMAKE_SYSTEM_PROCESSOR="${triplet%%-*}" \
        -DCMAKE_CXX_COMPILER="$triplet-g++" -DCMAKE_C_COMPILER="$triplet-gcc" \
        -DCMAKE_LIBRARY_ARCHITECTURE="$triplet" -DPKG_CONFIG_EXECUTABLE="$(command -v "$triplet-pkg-config")"
fi
cmake --build "$build" -j "$jobs"
machine=$(readelf -h "$build/tools/tavrixctl" | sed -n 's/^ *Machine: *//p')
case "$arch:$machine" in
    arm64:AArch64 | armhf:ARM) ;;
    *) echo "cross-build: $build/tools/tavrixctl is built for $machine, not $arch" >&2; exit 1 ;;
esac
ctest --test-dir "$build" -L "$label" -j "$jobs" --output-on-failure
