#!/usr/bin/env bash
# Every option a tool's --help names is in its manual page, so that an option added to a tool
# without its page fails here.
# usage: tests/install/check-manpages.sh BUILD_DIR SOURCE_DIR
set -euo pipefail
build=${1:?build directory}
source=${2:?source directory}
missing=0
for tool in tavrixctl tavrix-catalog tavrix-plist; do
    page="$source/docs/man/$tool.1"
    # Pages write a dash as \- : "--wait" is "\-\-wait" there.
    for option in $("$build/tools/$tool" --help | grep -oE -- '--[a-z][a-z-]*' | sort -u); do
        if ! grep -qF -- "${option//-/\\-}" "$page"; then
            echo "FAIL: $tool $option is not in docs/man/$tool.1" >&2
            missing=1
        fi
    done
done
[ "$missing" = 0 ] && echo "every option of --help is in its manual page"
