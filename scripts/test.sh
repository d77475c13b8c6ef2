#!/usr/bin/env bash
# Builds the project and runs every test on Linux (unit, end-to-end, Fortran
# callers, the command-line tool). Extra arguments go to ctest, e.g.
#   scripts/test.sh -L isort      only the sort's tests
#   scripts/test.sh -LE slow      skip the slow tier
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh
build=${ISORT_BUILD_DIR:-build}
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$build" -j"$(nproc)"
ctest --test-dir "$build" --output-on-failure -j"$(nproc)" "$@"
