#!/usr/bin/env bash
# Builds the fuzzers, runs each for some seconds, as many at a time as there are processors, and prints
# for each how many inputs it has tried, how many lines it has reached of the sources that it attacks (its
# lines "Covers:" name them), and whether it has found a fault. Fails when one has; the input is then in
# build/fuzz/found/, and what was said about it in build/fuzz/log/.
# Usage: scripts/fuzz.sh SECONDS [NAME ...], such as "scripts/fuzz.sh 60 Bundle Rules"
set -euo pipefail
cd "$(dirname "$0")/.."

seconds=${1:-}
case $seconds in
'' | *[!0-9]* | 0*)
    echo "usage: $0 SECONDS [NAME ...]" >&2
    exit 2
    ;;
esac
shift
sources=()
for name in "${@:-*}"; do sources+=(fuzz/*/Fuzz$name.cpp); done

cmake --preset fuzz > /dev/null
cmake --build --preset fuzz --target fuzzers

out=$PWD/build/fuzz
rm -rf "$out/found" "$out/log"
mkdir -p "$out/found" "$out/log"
export seconds out
# Files that are written for each input cost least in memory.
[ ! -w /dev/shm ] || export TMPDIR=/dev/shm

run() {
    local source=$1 name tried reached=- fault=none
    name=$(basename "$source" .cpp)
    name=${name#Fuzz}
    name=${name,,}
    mkdir -p "$out/corpus/$name"
    LLVM_PROFILE_FILE=$out/log/$name.profraw timeout --kill-after=10 $((seconds + 60)) \
        "$out/fuzz/fuzz_$name" -max_total_time="$seconds" -timeout=10 -rss_limit_mb=2048 \
        -max_len=65536 -dict="$PWD/fuzz/words.dict" -print_final_stats=1 -verbosity=0 \
        -artifact_prefix="$out/found/$name-" "$out/corpus/$name" "$PWD/fuzz/seeds/$name" \
        > "$out/log/$name" 2>&1 || fault=FOUND
    tried=$(sed -n 's/^stat::number_of_executed_units: *//p' "$out/log/$name")
    if [ "$fault" = none ]; then
        llvm-profdata merge -sparse -o "$out/log/$name.profile" "$out/log/$name.profraw"
        # The report names files by the ends of their paths.
        reached=$(llvm-cov report "$out/fuzz/fuzz_$name" -instr-profile="$out/log/$name.profile" |
            awk -v attacked="$(sed -n 's|^// Covers: ||p' "$source" | tr '\n' ' ')" '
                BEGIN { count = split(attacked, names, " ") }
                { for (i = 1; i <= count; ++i)
                      if (names[i] == $1 || substr(names[i], length(names[i]) - length($1)) == "/" $1) {
                          lines += $8
                          missed += $9
                      } }
                END { printf "%.1f%%", lines ? 100 * (lines - missed) / lines : 0 }')
    fi
    printf '%-16s %10s %8s   %s\n' "$name" "${tried:--}" "$reached" "$fault" | tee "$out/log/$name.result"
}
export -f run

printf '%-16s %10s %8s   %s\n' "$seconds s each" inputs lines fault
printf '%s\n' "${sources[@]}" | xargs -P "$(nproc)" -I{} bash -euo pipefail -c 'run {}'
if grep -l FOUND "$out"/log/*.result > /dev/null; then
    ls "$out/found"
    exit 1
fi
