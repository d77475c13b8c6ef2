#!/usr/bin/env bash
# Builds the project under the sanitizers and runs its tests there.
#   scripts/sanitize.sh asan   AddressSanitizer and UndefinedBehaviorSanitizer
#                              (build-asan/): every test but the slow tier
#   scripts/sanitize.sh tsan   ThreadSanitizer (build-tsan/): the tests that run
#                              threads (labels host, isort, sortfile, faults),
#                              without the slow tier
#   scripts/sanitize.sh all    both, one after the other (the default)
# Extra arguments go to ctest, e.g. scripts/sanitize.sh asan -R Fault. The
# slow tier (large sorts, minutes under a sanitizer) runs in the plain build;
# to run it here too: ctest --test-dir build-asan -L slow.
# Any report stops the test that made it and fails the run.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/install-deps.sh

which=${1:-all}
[ $# -gt 0 ] && shift
jobs=$(nproc)
generator=()
# Ninja when there is one (and the build directory is new or already Ninja's).
if command -v ninja >/dev/null; then generator=(-G Ninja); fi

# Every finding is fatal and printed with its stack.
export ASAN_OPTIONS=${ASAN_OPTIONS:-halt_on_error=1:abort_on_error=1:detect_leaks=1:detect_stack_use_after_return=1:check_initialization_order=1:strict_init_order=1:print_summary=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-halt_on_error=1:abort_on_error=1:print_stacktrace=1}
export TSAN_OPTIONS=${TSAN_OPTIONS:-halt_on_error=1:abort_on_error=1:second_deadlock_stack=1}

run() {  # run NAME SANITIZERS TOOLS CTEST-ARGS...
  local name=$1 sanitizers=$2 tools=$3
  shift 3
  local dir=build-$name start=$SECONDS
  local gen=("${generator[@]}")
  echo "== $name: building in $dir"
  if [ -f "$dir/CMakeCache.txt" ] && ! grep -q '^CMAKE_GENERATOR:INTERNAL=Ninja$' "$dir/CMakeCache.txt"; then
    gen=()  # keep the generator the directory was made with
  fi
  # -O1 and line tables only: quicker to build than the default -O2 -g, and
  # what the sanitizers' reports need.
  cmake -S . -B "$dir" "${gen[@]}" -DCMAKE_BUILD_TYPE=RelWithDebInfo \
        -DCMAKE_CXX_FLAGS_RELWITHDEBINFO="-O1 -g1" -DCMAKE_C_FLAGS_RELWITHDEBINFO="-O1 -g1" \
        -DCMAKE_Fortran_FLAGS_RELWITHDEBINFO="-O1 -g1" \
        -DISORT_SANITIZE="$sanitizers" -DISORT_BUILD_TOOLS="$tools" >/dev/null
  cmake --build "$dir" -j"$jobs"
  echo "== $name: testing (built in $((SECONDS - start)) s)"
  ctest --test-dir "$dir" --output-on-failure -j"$jobs" --timeout 900 "$@"
  echo "== $name: done in $((SECONDS - start)) s"
}

case $which in
  asan) run asan address,undefined ON -LE slow "$@" ;;
  tsan) run tsan thread OFF -L 'host|isort|sortfile|faults' -LE slow "$@" ;;
  all)
    run asan address,undefined ON -LE slow "$@"
    run tsan thread OFF -L 'host|isort|sortfile|faults' -LE slow "$@"
    ;;
  *)
    echo "usage: $0 [asan|tsan|all] [ctest arguments]" >&2
    exit 2
    ;;
esac
