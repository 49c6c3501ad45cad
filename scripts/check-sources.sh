#!/usr/bin/env bash
# Checks what needs no compiler: the format of the sources, and the floors of the house. A room includes
# only itself and rooms on floors before its own, and each by its path from the project's root.
set -euo pipefail
cd "$(dirname "$0")/.."

# Ground floor first. Rooms on one floor do not know each other.
floors='
platform/system/
platform/values/
platform/log/
platform/threads/
platform/plist/
platform/lum/
platform/sandbox/
platform/spawnerd/
platform/services/
platform/tandry/
platform/Services.h
Zorvan/
zrd/ tools/
'

status=0
git ls-files -z '*.cpp' '*.h' | xargs -0 -r clang-format --dry-run -Werror || status=1

# In: FILE:LINE:#include ... of every product source.
git grep -nE '^[[:space:]]*#[[:space:]]*include' -- platform Zorvan zrd tools |
    awk -v floors="$floors" '
    BEGIN {
        count = split(floors, lines, "\n")
        for (i = 1; i <= count; ++i) {
            rooms = split(lines[i], names, " ")
            for (j = 1; j <= rooms; ++j) floor[names[j]] = i
        }
    }
    function roomOf(path,   room) {
        for (room in floor) if (index(path, room) == 1) return room
        return ""
    }
    function refuse(why) { print "error: " $0 ": " why; bad = 1 }
    {
        split($0, place, ":")
        own = roomOf(place[1])
        match($0, /["<][^">]*/)
        included = roomOf(substr($0, RSTART + 1, RLENGTH - 1))
        isQuoted = substr($0, RSTART, 1) == "\""
        if (own == "") refuse("this source is in no room")
        else if (included == "" && isQuoted) refuse("not in a room by its path from the root")
        else if (included != "" && included != own && floor[included] >= floor[own])
            refuse(own " does not lie above " included)
    }
    END { exit bad }' >&2 || status=1

exit "$status"
