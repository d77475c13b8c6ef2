#!/usr/bin/env bash
# The demo: builds isort (in build/, as scripts/test.sh does), generates a
# survey-like CSV, sorts it by region and by income descending with --stats,
# shows the first lines of the result, then runs the library demo.
#
#   scripts/demo.sh [ROWS]        (default 2000000)
set -euo pipefail
root="$(cd "$(dirname "$(readlink -f "$0")")/.." && pwd)"
rows="${1:-2000000}"
build="${ISORT_BUILD_DIR:-$root/build}"

"$root/scripts/install-deps.sh"
cmake -S "$root" -B "$build" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$build" -j"$(nproc)" --target isort_cli isortdemo

isort="$build/tools/cli/isort"
work="$(mktemp -d "${TMPDIR:-/tmp}/isort-demo-XXXXXX")"
trap 'rm -rf "$work"' EXIT

echo
echo "== isort gen --rows $rows --seed 1 -o survey.csv"
"$isort" gen --rows "$rows" --seed 1 -o "$work/survey.csv"
ls -l "$work/survey.csv" | awk '{print "   " $5 " bytes"}'
head -n 4 "$work/survey.csv" | sed 's/^/   /'

echo
echo "== isort sort -k region -k income:n:desc --stats survey.csv -o sorted.csv"
"$isort" sort -k region -k income:n:desc --stats "$work/survey.csv" -o "$work/sorted.csv"

echo
echo "== head sorted.csv"
head -n 8 "$work/sorted.csv" | sed 's/^/   /'

echo
echo "== isortdemo (the library on 3,000,000 generated records)"
"$build/tools/demo/isortdemo"
