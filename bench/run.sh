#!/usr/bin/env bash
# Runs every benchmark of the build and prints each beside its peer. The text also goes to
# BUILD_DIR/bench/summary.txt and every row to BUILD_DIR/bench/summary.json.
# usage: bench/run.sh BUILD_DIR
set -euo pipefail
build=${1:-build}
out="$build/bench"
rows="$out/summary.rows"
: > "$rows"
export TAVRIX_BENCH_SUMMARY="$PWD/$rows"
[ "${rows#/}" != "$rows" ] && export TAVRIX_BENCH_SUMMARY="$rows"
started=$(date -u +%Y-%m-%dT%H:%MZ)
load=$(cut -d' ' -f1-3 /proc/loadavg)
{
echo "tavrixservicesd benchmarks — $started, $(nproc) cores, $(uname -r), load $load"
# Benchmarks that write files work in a tmpfs: this machine's ext4 has no journal and creating
# files after many deletions there is much slower than usual.
export TMPDIR=/dev/shm
echo "temporary files on: $(df --output=fstype "$TMPDIR" | tail -1) ($TMPDIR)"
for bench in "$build"/bench/*_bench; do
    [ -x "$bench" ] || continue
    "$bench"
done
} | tee "$out/summary.txt"
{
    printf '{"started": "%s", "cores": %s, "load": "%s", "rows": [\n' "$started" "$(nproc)" "$load"
    sed '$!s/$/,/' "$rows"
    printf ']}\n'
} > "$out/summary.json"
rm -f "$rows"
echo "summary: $out/summary.txt, $out/summary.json"
