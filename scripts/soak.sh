#!/usr/bin/env bash
# Builds the daemon and has honest clients, hostile ones, applications that come and go, and plug-ins use
# it at once, for so many minutes (besides a quarter of that to warm up). Fails when it has lost descriptors
# or memory, or when somebody honest was refused, cut off or kept waiting.
# Usage: scripts/soak.sh MINUTES [PRESET, default release]
set -euo pipefail
cd "$(dirname "$0")/.."

minutes=${1:?usage: scripts/soak.sh MINUTES [PRESET]}
preset=${2:-release}
scripts/deps.sh
cmake --preset "$preset" -D ZR_BENCH=ON > /dev/null
cmake --build --preset "$preset" --target zrd_soak
exec "build/$preset/bench/zrd_soak" "$minutes"
