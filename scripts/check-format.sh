#!/usr/bin/env bash
# Checks what needs no compiler: the format of the sources, and that no floor includes one above it.
set -euo pipefail
cd "$(dirname "$0")/.."

status=0
git ls-files -z '*.cpp' '*.h' | xargs -0 -r clang-format --dry-run -Werror || status=1

# no_include FOLDER PREFIXES: sources of FOLDER include nothing that begins with one of PREFIXES.
no_include() {
    if git grep -nE "^[[:space:]]*#[[:space:]]*include[[:space:]]*[<\"]($2)/" -- "$1"; then
        echo "error: $1/ lies below what it includes here" >&2
        status=1
    fi
}
no_include platform 'Zorvan|zrd|tools'
no_include Zorvan 'zrd|tools'
no_include zrd 'tools'
no_include tools 'zrd'

exit "$status"
