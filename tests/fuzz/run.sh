#!/usr/bin/env bash
# Runs every fuzz target for the given number of seconds each, starting from its seed corpus.
# A target may have <name>.options (more libFuzzer flags, e.g. a larger -max_len) and
# <name>_seeds.py (writes seeds too large to keep in the repository into a directory).
# usage: tests/fuzz/run.sh BUILD_DIR SECONDS [TARGET...]
set -euo pipefail
build=${1:?build directory}
seconds=${2:-60}
shift 2 || true
here=$(cd "$(dirname "$0")" && pwd)
status=0
targets=("$@")
if [ ${#targets[@]} -eq 0 ]; then
    for target in "$build"/tests/fuzz/*_fuzz; do
        targets+=("$(basename "$target" _fuzz)")
    done
fi
for name in "${targets[@]}"; do
    target="$build/tests/fuzz/${name}_fuzz"
    work=$(mktemp -d)
    corpora=("$work/corpus")
    mkdir "$work/corpus"
    [ -d "$here/corpus/$name" ] && corpora+=("$here/corpus/$name")
    if [ -f "$here/${name}_seeds.py" ]; then
        python3 "$here/${name}_seeds.py" "$work/seeds"
        corpora+=("$work/seeds")
    fi
    options=()
    [ -f "$here/$name.options" ] && read -r -a options <"$here/$name.options"
    echo "== $name: ${seconds}s ${options[*]}"
    # Later flags win, so a target's options override the defaults.
    if ! "$target" -max_total_time="$seconds" -max_len=65536 -timeout=10 -rss_limit_mb=2048 \
        "${options[@]}" -artifact_prefix="$build/" "${corpora[@]}" 2>"$work/log"; then
        tail -40 "$work/log"
        status=1
    else
        grep -E "^(#[0-9]+|Done)" "$work/log" | tail -2
    fi
    rm -rf "$work"
done
exit $status
