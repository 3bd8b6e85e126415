#!/bin/bash
# Every include between the folders of src/ points down the layer order (docs/architecture.md).
set -euo pipefail
src="${1:?usage: check-layers.sh SRC_DIR}"
declare -A below=(
    [io]="" [plist]="io" [util]="plist io" [device]="util plist io"
    [bus]="device util plist io" [http]="util" [payload]="device util plist io"
    [catalog]="payload http bus device util plist io"
    [bundle]="payload http bus device util plist io"
    [update]="bundle catalog payload http bus device util plist io"
    [daemon]="update bundle catalog payload http bus device util plist io"
    [client]="bus plist"
)
status=0
for directory in "$src"/*/; do
    name=$(basename "$directory")
    [[ -v below[$name] ]] || { echo "$name: a folder with no place in the layer order"; status=1; }
done
for folder in "${!below[@]}"; do
    while IFS=: read -r file line text; do
        target=$(sed -E 's/.*#include "([a-z]+)\/.*/\1/' <<<"$text")
        [[ $target == "$folder" || " ${below[$folder]} " == *" $target "* ]] && continue
        echo "$file:$line: $folder may not include $target: $text"
        status=1
    done < <(grep -rnE '^#include "[a-z]+/' "$src/$folder" || true)
done
exit $status
