#!/usr/bin/env bash
# Every include of the daemon points to its own folder or a lower floor:
#   common < platform < record < storage < transist, collectors, config < core
# (the three of floor 5 are siblings: none includes another); tools use only
# common and platform. Prints each forbidden include and fails.
set -eu
cd "$(dirname "$0")/.."
declare -A allowed=(
    [common]=""
    [platform]="common"
    [record]="platform common"
    [storage]="record platform common"
    [transist]="storage record platform common"
    [collectors]="record platform common"
    [config]="storage record platform common"
    [core]="config transist collectors storage record platform common"
    [tools]="platform common"
)
status=0
for dir in "${!allowed[@]}"; do
    while IFS= read -r hit; do
        inc=${hit#*#include \"}
        inc=${inc%%/*}
        [ "$inc" = "$dir" ] && continue
        case " ${allowed[$dir]} " in *" $inc "*) continue ;; esac
        echo "forbidden include from $dir/: $hit" >&2
        status=1
    done < <(grep -rHn --include='*.cpp' --include='*.h' '^#include "[a-z_]*/' "$dir" || true)
done
exit $status
