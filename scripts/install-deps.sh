#!/usr/bin/env bash
# Installs the Debian packages the project builds, tests and runs with; does nothing when all
# are present. Runs apt-get as root, through sudo otherwise. Fetches go again when a mirror is
# caught mid-sync (scripts/fetch-retry.sh); one that keeps failing exits with status 75.
#   --deb    also what building and checking the Debian packages needs
#   --boot   also what the boot test needs (a container image booted with systemd)
#   --emulate=ARCH  what a cross build for ARCH (arm64, armhf) needs on the build machine: the
#            build root's tools (debootstrap, systemd-nspawn) and qemu, registered with the kernel
#   --cross=ARCH  instead of the native libraries and compilers: Debian's cross toolchain and
#            the libraries for ARCH, beside the build tools and the programs the tests run (in
#            the build root scripts/cross-build.sh makes)
set -euo pipefail
. "$(dirname "$0")/fetch-retry.sh"

build_tools=(build-essential cmake ninja-build pkg-config nlohmann-json3-dev)
native=(
    clang libclang-rt-14-dev clang-format
    libsystemd-dev libplist-dev libarchive-dev libcurl4-openssl-dev libssl-dev libsodium-dev zlib1g-dev
    libgtest-dev libgmock-dev libbenchmark-dev
)
# The programs the tests run; busctl, which follows the bus in the integration tests, is systemd's.
test_tools=(dbus systemd libarchive-tools curl python3 python3-dbus tzdata libplist-utils strace)

extra=()
cross=()
emulate=()
for flag in "$@"; do
    case "$flag" in
        --deb) extra+=(debhelper dpkg-dev fakeroot lintian systemd) ;;
        --boot) extra+=(systemd-container debootstrap) ;;
        --emulate=arm64 | --emulate=armhf)
            emulate+=("${flag#--emulate=}")
            extra+=(systemd-container debootstrap qemu-user-static)
            ;;
        --cross=arm64 | --cross=armhf)
            arch=${flag#--cross=}
            cross+=("$arch")
            extra+=(crossbuild-essential-"$arch" dpkg-dev pkgconf:"$arch")
            for library in libsystemd-dev libplist-dev libarchive-dev libcurl4-openssl-dev libssl-dev \
                libsodium-dev zlib1g-dev libgtest-dev libgmock-dev; do
                extra+=("$library:$arch")
            done
            ;;
        *)
            echo "install-deps: unknown flag $flag" \
                "(known: --deb --boot --emulate=arm64|armhf --cross=arm64|armhf)" >&2
            exit 2
            ;;
    esac
done
if [ ${#cross[@]} -gt 0 ]; then
    packages=("${build_tools[@]}" "${test_tools[@]}" "${extra[@]}")
else
    packages=("${build_tools[@]}" "${native[@]}" "${test_tools[@]}" "${extra[@]}")
fi

sudo=""
if [ "$(id -u)" -ne 0 ]; then
    sudo="sudo"
fi

missing=()
for package in "${packages[@]}"; do
    if ! dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q "install ok installed"; then
        missing+=("$package")
    fi
done

if [ ${#missing[@]} -gt 0 ]; then
    # An architecture added here goes again when its packages cannot be had: its broken index
    # would fail every later apt-get update on the machine.
    added=()
    trap 'for arch in "${added[@]}"; do $sudo dpkg --remove-architecture "$arch"; done' EXIT
    for arch in "${cross[@]}"; do
        if ! dpkg --print-foreign-architectures | grep -qx "$arch"; then
            $sudo dpkg --add-architecture "$arch"
            added+=("$arch")
        fi
    done
    echo "Installing: ${missing[*]}"
    export DEBIAN_FRONTEND=noninteractive
    fetch_retry "apt-get update" $sudo apt-get update -qq
    # Whether the packages can be installed needs no network: that fails at once, untried again.
    $sudo apt-get install -s -qq --no-install-recommends "${missing[@]}" >/dev/null
    fetch_retry "downloading the packages" \
        $sudo apt-get install -d -y -qq --no-install-recommends "${missing[@]}"
    $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
    trap - EXIT
fi

# Programs built for ARCH run through qemu when the kernel knows it: tests start the daemon and
# the tools as any program would. Without a service manager nobody registers it at install. The
# registration opens qemu at once (flag F), so that it runs in a build root too.
for arch in "${emulate[@]}"; do
    case "$arch" in arm64) emulator=qemu-aarch64 ;; armhf) emulator=qemu-arm ;; esac
    binfmt=/proc/sys/fs/binfmt_misc
    [ -e "$binfmt/register" ] || $sudo mount -t binfmt_misc binfmt_misc "$binfmt"
    [ -e "$binfmt/$emulator" ] ||
        $sudo sh -c "grep -v '^#' /usr/lib/binfmt.d/$emulator.conf >$binfmt/register"
done
