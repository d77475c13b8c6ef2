#!/usr/bin/env bash
# Builds the libFuzzer targets of fuzz/ with clang (address and undefined-
# behaviour checks) into build-fuzz/ and runs each for a while, starting from
# its committed seed corpus in fuzz/corpus/<target>/.
#   scripts/fuzz.sh [SECONDS] [TARGET...]
# SECONDS per target, default 25; targets: codec unpack srtfva sortfile (all by
# default). New inputs found are kept in build-fuzz/corpus/<target>/ for the
# next run; an input that fails is left in build-fuzz/findings/ and the
# script fails. Turn each finding into a unit test before fixing it.
set -euo pipefail
cd "$(dirname "$0")/.."
# shellcheck source=apt-ensure.sh
. scripts/apt-ensure.sh
apt_ensure clang libclang-rt-dev cmake

seconds=${1:-25}
[ $# -gt 0 ] && shift
targets=("$@")
[ ${#targets[@]} -eq 0 ] && targets=(codec unpack srtfva sortfile)

build=build-fuzz
cmake -S fuzz -B "$build" -DCMAKE_CXX_COMPILER=clang++ >/dev/null
cmake --build "$build" -j"$(nproc)"

export ASAN_OPTIONS=${ASAN_OPTIONS:-halt_on_error=1:abort_on_error=1:detect_leaks=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-halt_on_error=1:print_stacktrace=1}
mkdir -p "$build/findings"
tmp=$(mktemp -d)
trap 'rm -rf "$tmp"' EXIT
status=0
for t in "${targets[@]}"; do
  mkdir -p "$build/corpus/$t"
  log="$build/$t.log"
  echo "== $t: ${seconds} s"
  # The temporary files of the targets that make them go to a directory of
  # their own, removed afterwards.
  if TMPDIR=$tmp "$build/${t}_fuzz" -max_total_time="$seconds" -timeout=20 -rss_limit_mb=4096 \
       -print_final_stats=1 -artifact_prefix="$build/findings/${t}-" \
       "$build/corpus/$t" "fuzz/corpus/$t" >"$log" 2>&1; then
    runs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")
    echo "   ${runs:-?} executions, corpus $(ls "$build/corpus/$t" | wc -l) inputs"
  else
    status=1
    echo "   FAILED: see $log and $build/findings/"
    grep -m 20 -E 'ERROR|SUMMARY|runtime error|disagreement|packed records|SRTFVA|SORTFILE' "$log" || true
  fi
done
exit $status
