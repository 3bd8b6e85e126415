#!/usr/bin/env bash
# Commit subjects fit in 72 columns, as one-line logs and mail subjects show them: every commit
# after the one where the project took up the rule. Skipped (saying so) outside a git checkout.
set -euo pipefail
repository=$1
since=ea49e77ccfc19d1735030f854d33fbdfb3304d64
if ! command -v git >/dev/null ||
    ! git -C "$repository" cat-file -e "$since^{commit}" 2>/dev/null; then
    echo "skipped: $repository is not a git checkout holding $since"
    exit 0
fi
long=$(git -C "$repository" log --format='%h %s' "$since..HEAD" | awk 'length($0) - index($0, " ") > 72')
if [ -n "$long" ]; then
    echo "Commit subjects longer than 72 characters:"
    echo "$long"
    exit 1
fi
echo "every subject since ${since:0:12} fits in 72 characters"
