#!/usr/bin/env bash
# Builds the release and measures the daemon. Options go to the program: --quick, --tsv.
set -euo pipefail

cd "$(dirname "$0")/.."
scripts/deps.sh >&2
cmake --preset release >&2
cmake --build --preset release --target zrd_bench >&2
exec build/release/bench/zrd_bench "$@"
