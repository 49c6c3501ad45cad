#!/usr/bin/env bash
# Builds the fuzzers and runs each for some seconds. Fails when one finds a fault, whose input it leaves
# in build/fuzz/found/.
# Usage: scripts/fuzz-smoke.sh [SECONDS, default 20]
set -euo pipefail

cd "$(dirname "$0")/.."
seconds=${1:-20}
case $seconds in
'' | *[!0-9]* | 0*)
    echo "usage: $0 [SECONDS]" >&2
    exit 2
    ;;
esac

fuzzers=()
for source in fuzz/*/Fuzz*.cpp; do
    name=$(basename "$source" .cpp)
    name=${name#Fuzz}
    fuzzers+=("fuzz_${name,,}")
done

cmake --preset fuzz >/dev/null
cmake --build --preset fuzz --target "${fuzzers[@]}"

found=build/fuzz/found
mkdir -p "$found"
for fuzzer in "${fuzzers[@]}"; do
    corpus=build/fuzz/corpus/$fuzzer
    seeds=fuzz/seeds/${fuzzer#fuzz_}
    mkdir -p "$corpus"
    [ -d "$seeds" ] || seeds=
    echo "== $fuzzer, $seconds s"
    timeout --kill-after=10 $((seconds + 60)) "build/fuzz/fuzz/$fuzzer" \
        -max_total_time="$seconds" -timeout=10 -rss_limit_mb=1024 -max_len=65536 \
        -print_final_stats=0 -verbosity=0 -artifact_prefix="$found/" \
        "$corpus" ${seeds:+"$seeds"}
done
echo "no faults found"
