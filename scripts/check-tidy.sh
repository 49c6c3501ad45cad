#!/usr/bin/env bash
# Runs clang-tidy over product sources, those that changed last first, with the compile commands of the
# preset "release". All of them take half an hour: with a limit, what is reached within it is looked at.
# Usage: scripts/check-tidy.sh [--minutes N] [FILE...]
set -euo pipefail
cd "$(dirname "$0")/.."

deadline=9999999999
if [ "${1:-}" = --minutes ]; then
    deadline=$(($(date +%s) + $2 * 60))
    shift 2
fi
cmake --preset release > /dev/null
sources=build/release/tidy-sources
looked=build/release/tidy-looked

# Every source once, by its newest commit; what is not committed yet comes first.
newestFirst() {
    {
        git diff --name-only HEAD
        git log --format= --name-only
    } | awk '/^(platform|Zorvan|zrd|tools)\/.*\.cpp$/ && !seen[$0]++' |
        while read -r file; do [ ! -e "$file" ] || echo "$file"; done
}
if [ "$#" -gt 0 ]; then printf '%s\n' "$@"; else newestFirst; fi > "$sources"

: > "$looked"
export deadline looked
status=0
# shellcheck disable=SC2016 # the inner shell expands
xargs -r -P "$(nproc)" -I{} bash -c '
    [ "$(date +%s)" -lt "$deadline" ] || exit 0
    echo "$1" >> "$looked"
    clang-tidy -p build/release --quiet "$1" 2> /dev/null' _ {} < "$sources" || status=1
echo "looked at $(wc -l < "$looked") of $(wc -l < "$sources") sources"
exit "$status"
