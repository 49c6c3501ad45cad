#!/usr/bin/env bash
# Builds the fuzzers, runs each for some seconds, as many at a time as there are processors, and prints
# for each how many inputs it has tried, how many lines it has reached of the sources that it attacks, and
# whether it has found a fault. Fails when one has; the input is then in build/fuzz/found/, and what was said
# about it in build/fuzz/log/. The lines that were not reached are in build/fuzz/log/NAME.missed.
#
# What counts: of the files in a fuzzer's lines "Covers:", every line with code but those of the functions in
# fuzz/not-parsing, which no input comes to. Input is what a peer sends or a file holds.
# Usage: scripts/fuzz.sh SECONDS [NAME ...], such as "scripts/fuzz.sh 60 Bundle Rules"; 0 seconds try what is
# known alone.
set -euo pipefail
cd "$(dirname "$0")/.."

seconds=${1:-}
case $seconds in
'' | *[!0-9]* | 0?*)
    echo "usage: $0 SECONDS [NAME ...]" >&2
    exit 2
    ;;
esac
shift
sources=()
# shellcheck disable=SC2206
for name in "${@:-*}"; do sources+=(fuzz/*/Fuzz$name.cpp); done

cmake --preset fuzz > /dev/null
cmake --build --preset fuzz --target fuzzers

out=$PWD/build/fuzz
mkdir -p "$out/found" "$out/log"
limit=-max_total_time=$seconds
[ "$seconds" != 0 ] || limit=-runs=0
export seconds limit out
# Files that are written for each input cost least in memory.
[ ! -w /dev/shm ] || export TMPDIR=/dev/shm

# Reads what "llvm-cov show" says of all files, and fuzz/not-parsing; names the lines of those attacked that
# were not reached, and says last what part of all was. A function ends with the first brace that stands alone
# at the beginning of a line.
# shellcheck disable=SC2016
export countLines='
    BEGIN {
        for (i = split(attacked, names, " "); i > 0; --i) counts[names[i]] = 1
        while ((getline line < table) > 0) {
            fields = split(line, field, " ")
            if (fields > 1 && line !~ /^#/) left[field[1], ++leaves[field[1]]] = field[2]
        }
    }
    /^\/.*:$/ { file = substr($0, length(root) + 2, length($0) - length(root) - 2); out = 0 }
    file in counts && /\|/ {
        bar = index($0, "|")
        rest = substr($0, bar + 1)
        reached = substr(rest, 1, index(rest, "|") - 1)
        text = substr(rest, index(rest, "|") + 1)
        gsub(/ /, "", reached)
        for (i = 1; !out && text ~ /^[A-Za-z]/ && i <= leaves[file]; ++i)
            out = index(text, left[file, i] "(") > 0
        if (!out && reached != "") {
            ++lines
            if (reached == "0") { ++missed; print file ":" $1 + 0 ":" text }
        }
        if (text ~ /^}/ || text ~ /^[A-Za-z].*}$/) out = 0
    }
    END { printf "%.1f%%\n", lines ? 100 * (lines - missed) / lines : 0 }'

run() {
    local source=$1 name tried reached=- fault=none
    name=$(basename "$source" .cpp)
    name=${name#Fuzz}
    name=${name,,}
    rm -f "$out/found/$name"-* "$out/log/$name" "$out/log/$name".*
    mkdir -p "$out/corpus/$name"
    LLVM_PROFILE_FILE=$out/log/$name.profraw timeout --kill-after=10 $((seconds + 60)) \
        "$out/fuzz/fuzz_$name" "$limit" -timeout=10 -rss_limit_mb=2048 \
        -max_len=65536 -dict="$PWD/fuzz/words.dict" -print_final_stats=1 -verbosity=0 \
        -artifact_prefix="$out/found/$name-" "$out/corpus/$name" "$PWD/fuzz/seeds/$name" \
        > "$out/log/$name" 2>&1 || fault=FOUND
    tried=$(sed -n 's/^stat::number_of_executed_units: *//p' "$out/log/$name")
    if [ "$fault" = none ]; then
        llvm-profdata merge -sparse -o "$out/log/$name.profile" "$out/log/$name.profraw"
        # Of all files, for the program may know a file by another path than the one that is shown.
        llvm-cov show "$out/fuzz/fuzz_$name" -instr-profile="$out/log/$name.profile" \
            -show-instantiations=false |
            awk -v attacked="$(sed -n 's|^// Covers: ||p' "$source" | tr '\n' ' ')" \
                -v table=fuzz/not-parsing -v root="$PWD" "$countLines" > "$out/log/$name.missed"
        reached=$(tail -n 1 "$out/log/$name.missed")
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
