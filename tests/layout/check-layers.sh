#!/bin/bash
# Every include between the folders of src/ points down the layer order (docs/architecture.md).
set -euo pipefail
src="${1:?usage: check-layers.sh SRC_DIR}"
declare -A below=(
    [base]="" [io]="base" [plist]="io base" [util]="plist io base"
    [device]="util plist io base" [bus]="device util plist io base" [http]="util base"
    [payload]="device util plist io base"
    [catalog]="payload http bus device util plist io base"
    [bundle]="payload http bus device util plist io base"
    [update]="bundle catalog payload http bus device util plist io base"
    [daemon]="update bundle catalog payload http bus device util plist io base"
    [client]="bus plist base"
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
