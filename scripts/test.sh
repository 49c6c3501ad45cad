#!/usr/bin/env bash
# Installs what zrd needs, builds it and runs all tests. Works from a fresh clone on a bare Debian
# machine, as root or with sudo. Arguments go to ctest (for example -R Rules).
set -euo pipefail
cd "$(dirname "$0")/.."

scripts/deps.sh
cmake --preset release
cmake --build --preset release
ctest --preset release -j2 "$@"
echo "All tests passed."
