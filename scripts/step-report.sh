# Sourced by the scenario scripts: one PASS/FAIL line per step, counted in passed and failed; a
# failed step shows the end of its output, kept in $work/step.log.
passed=0
failed=0
report() {
    if [ "$1" = 0 ]; then
        printf 'PASS  %s\n' "$2"
        passed=$((passed + 1))
    else
        printf 'FAIL  %s\n' "$2"
        sed 's/^/      | /' "$work/step.log" | tail -n 15
        failed=$((failed + 1))
    fi
}
