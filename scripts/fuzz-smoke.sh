#!/usr/bin/env bash
# Each fuzzer for a few seconds: catches what a change broke outright.
# Usage: scripts/fuzz-smoke.sh [SECONDS, default 5]
set -euo pipefail
exec "$(dirname "$0")/fuzz.sh" "${1:-5}"
