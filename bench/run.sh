#!/usr/bin/env bash
# Runs every benchmark of the build and prints each beside its peer.
# usage: bench/run.sh BUILD_DIR
set -euo pipefail
build=${1:-build}
echo "tavrixservicesd benchmarks — $(date -u +%Y-%m-%dT%H:%MZ), $(nproc) cores, $(uname -r)"
# Benchmarks that write files work in a tmpfs: this machine's ext4 has no journal and creating
# files after many deletions there is much slower than usual.
export TMPDIR=/dev/shm
echo "temporary files on: $(df --output=fstype "$TMPDIR" | tail -1) ($TMPDIR)"
for bench in "$build"/bench/*_bench; do
    [ -x "$bench" ] || continue
    "$bench"
done
