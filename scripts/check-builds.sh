#!/usr/bin/env bash
# Builds the product as packagers and other projects do, in two builds that differ from the presets in all
# that people vary, and tries what came out.
# Usage: scripts/check-builds.sh [DIRECTORY, default a temporary one]
set -euo pipefail
cd "$(dirname "$0")/.."

root=${1:-$(mktemp -d)}
[ -n "${1:-}" ] || trap 'rm -rf "$root"' EXIT
options=(-DBUILD_TESTING=OFF -DZR_BENCH=OFF)

# try BINARY_DIR: what was built there runs.
try() {
    "$1/tools/zrctl/zrctl" --version
    local status=0
    "$1/zrd/zrd" operand 2> /dev/null || status=$?
    [ "$status" = 2 ]
}

# By clang, in a path with a space, as a part of another project, with the flags of a distribution's
# packages and no build type.
outer="$root/another project"
mkdir -p "$outer/zrd"
git ls-files -z | tar --null -T - -c | tar -x -C "$outer/zrd"
cat > "$outer/CMakeLists.txt" << 'LISTS'
cmake_minimum_required(VERSION 3.25)
project(outer LANGUAGES CXX)
add_subdirectory(zrd)
LISTS
(
    eval "$(dpkg-buildflags --export=sh)"
    CXX=clang++ cmake -G Ninja -S "$outer" -B "$outer/build" "${options[@]}" > /dev/null
    cmake --build "$outer/build" -j2
)
try "$outer/build/zrd"

# By g++ with all its optimisations, which warn of more than the presets' do: such warnings are errors
# here, so that whoever builds a release sees none.
cmake -G "Unix Makefiles" -S . -B "$root/release" -DCMAKE_BUILD_TYPE=Release \
    -DCMAKE_COMPILE_WARNING_AS_ERROR=ON "${options[@]}" > /dev/null
cmake --build "$root/release" -j2
try "$root/release"
