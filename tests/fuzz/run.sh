#!/usr/bin/env bash
# Runs every fuzz target for the given number of seconds each, starting from its seed corpus.
# usage: tests/fuzz/run.sh BUILD_DIR SECONDS
set -euo pipefail
build=${1:?build directory}
seconds=${2:-60}
here=$(cd "$(dirname "$0")" && pwd)
status=0
for target in "$build"/tests/fuzz/*_fuzz; do
    name=$(basename "$target" _fuzz)
    seeds="$here/corpus/$name"
    work=$(mktemp -d)
    echo "== $name: ${seconds}s"
    if ! "$target" -max_total_time="$seconds" -max_len=65536 -timeout=10 -rss_limit_mb=2048 \
        -artifact_prefix="$build/" "$work" ${seeds:+$( [ -d "$seeds" ] && echo "$seeds")} 2>"$work.log"; then
        tail -40 "$work.log"
        status=1
    else
        grep -E "^(#[0-9]+|Done)" "$work.log" | tail -2
    fi
    rm -rf "$work" "$work.log"
done
exit $status
