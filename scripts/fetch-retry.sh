# Sourced by the scripts that fetch from Debian's mirrors. A mirror caught mid-sync serves
# indexes that do not match their Release file for a while, so a fetch goes again after a pause
# before it counts as failed.
# fetch_retry WHAT COMMAND...: runs COMMAND up to TAVRIX_FETCH_TRIES times (4), pausing
# TAVRIX_FETCH_PAUSE seconds (30) after the first failure and twice as long after each next one.
# When every try fails it says so on stderr with the word NETWORK, and returns 75 (EX_TEMPFAIL):
# the mirror or the network failed, not the project, and callers pass that status on.
fetch_retry() {
    local what=$1 tries=${TAVRIX_FETCH_TRIES:-4} pause=${TAVRIX_FETCH_PAUSE:-30} try
    shift
    for ((try = 1; ; try++)); do
        "$@" && return 0
        if [ "$try" -ge "$tries" ]; then
            echo "NETWORK: $what failed $tries times; the mirror or the network is at fault," \
                "not the project (status 75)" >&2
            return 75
        fi
        echo "$what failed (try $try of $tries), again in $pause s" >&2
        sleep "$pause"
        pause=$((pause * 2))
    done
}
