#!/usr/bin/env bash
# Installs the Debian packages the project builds, tests and runs with; does nothing when all
# are present. Runs apt-get as root, through sudo otherwise.
set -euo pipefail

packages=(
    build-essential cmake ninja-build pkg-config clang libclang-rt-14-dev clang-format
    libsystemd-dev libplist-dev libarchive-dev libcurl4-openssl-dev libssl-dev libsodium-dev zlib1g-dev
    nlohmann-json3-dev
    libgtest-dev libgmock-dev libbenchmark-dev
    dbus libarchive-tools curl python3 python3-dbus tzdata libplist-utils strace
)

# `--deb`: also what building and checking the Debian package needs.
if [ "${1:-}" = "--deb" ]; then
    packages+=(debhelper dpkg-dev fakeroot lintian systemd)
fi

missing=()
for package in "${packages[@]}"; do
    if ! dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q "install ok installed"; then
        missing+=("$package")
    fi
done
[ ${#missing[@]} -eq 0 ] && exit 0

sudo=""
if [ "$(id -u)" -ne 0 ]; then
    sudo="sudo"
fi
echo "Installing: ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -qq
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
