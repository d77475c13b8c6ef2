#!/usr/bin/env bash
# Cross-builds the project for 32-bit Windows (win32-build.sh), checks the
# exports of isort.dll when it is built, and runs the test suite under wine
# (wine-root.sh builds the 32-bit root with wine once). Arguments go to ctest.
set -euo pipefail
here=$(dirname "$(readlink -f "$0")")
top=$(dirname "$here")
build=${ISORT_WIN32_BUILD:-$top/build-win32}
"$here/win32-build.sh" "$build"
dll=$(find "$build" -name CMakeFiles -prune -o -name isort.dll -print | head -n 1)
if [ -z "$dll" ]; then
  dll=$(find "$build" -name CMakeFiles -prune -o -name libisort.dll -print | head -n 1)
  [ -n "$dll" ] && echo "win32-test: warning: the sort library is built as libisort.dll, not isort.dll" >&2
fi
[ -n "$dll" ] && "$here/check-exports.sh" "$dll"
"$here/wine-root.sh"
cd "$build"
ctest --output-on-failure --timeout 600 -j "$(nproc)" "$@"
