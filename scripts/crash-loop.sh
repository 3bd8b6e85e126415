#!/bin/sh
# Kills the daemon at random instants of SetTavrixID (multi-megabyte payload) and of an
# over-the-air update, many times over, and checks that every next launch finds one whole state.
# Prints, per loop, the iterations, the states found right after the kills and the repairs made.
#
#   scripts/crash-loop.sh [ITERATIONS] [BUILD_DIR]     (default 300 iterations, build/)
set -eu
iterations=${1:-300}
build=${2:-build}
binary="$build/tests/integration/integration_tests"
if [ ! -x "$binary" ]; then
    echo "crash-loop: $binary is missing; build the project first" >&2
    exit 1
fi
status=0
for test in 'BundleFlowTest.KilledAnywhereInSetTavrixIDTheNextLaunchFindsOneWholeState' \
            'OverTheAirUpdateTest.KilledAnywhereInAnUpdateTheNextLaunchCompletesOrRedoesIt'; do
    log=$(mktemp)
    if TAVRIX_CRASH_LOOP_ITERATIONS="$iterations" "$binary" --gtest_filter="$test" >"$log" 2>&1; then
        result=passed
    else
        result=FAILED
        status=1
    fi
    summary=$(grep '^\[ crash loop \]' "$log" || echo "[ crash loop ] no summary")
    echo "$test: $result"
    echo "  $summary"
    if [ "$result" = FAILED ]; then
        grep -E 'Failure|seed|iteration|version' "$log" | head -20 | sed 's/^/  /'
    fi
    rm -f "$log"
done
exit $status
