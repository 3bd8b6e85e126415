#!/usr/bin/env bash
# Builds the project for another Debian architecture with Debian's cross toolchain and that
# architecture's -dev packages, then runs the tests labelled LABEL (default: unit) under qemu.
# The kernel hands the binaries to qemu (binfmt_misc), so that the tests and the programs they
# start run as on a device, under their own names.
# usage: scripts/cross-build.sh ARCH [LABEL]    (ARCH: arm64 or armhf; build in build-ARCH/)
set -euo pipefail
cd "$(dirname "$0")/.."
arch=${1:?usage: scripts/cross-build.sh ARCH [LABEL]}
label=${2:-unit}
jobs=${JOBS:-2}
case "$arch" in
    arm64) emulator=qemu-aarch64 ;;
    armhf) emulator=qemu-arm ;;
    *) echo "cross-build: no cross build for $arch (arm64, armhf)" >&2; exit 2 ;;
esac
scripts/install-deps.sh "--cross=$arch"
triplet=$(dpkg-architecture -a"$arch" -qDEB_HOST_MULTIARCH 2>/dev/null)
build=build-$arch
[ -e "/proc/sys/fs/binfmt_misc/$emulator" ] ||
    { echo "cross-build: $emulator is not registered with binfmt_misc" >&2; exit 1; }

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
