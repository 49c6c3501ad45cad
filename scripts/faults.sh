#!/usr/bin/env bash
# Builds the release and has the daemon store things while it is killed at each system call of that work,
# or while that call fails, for lack of space or descriptors, or for a fault of the disk. Whatever it has
# promised is there afterwards, and everything else as it was or as it was to be.
# Usage: scripts/faults.sh [--short | GTEST OPTIONS]; --short takes every 40th fault
set -euo pipefail
cd "$(dirname "$0")/.."

if [ "${1:-}" = --short ]; then
    export ZR_FAULTS_EVERY=40
    shift
fi
scripts/deps.sh
cmake --preset release > /dev/null
cmake --build --preset release --target fault_tests
exec build/release/tests/fault_tests --gtest_brief=1 "$@"
