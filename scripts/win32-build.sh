#!/usr/bin/env bash
# Cross-builds the project for 32-bit Windows into build-win32/ (or $1):
# isort.dll, vexahost.dll and the test programs. Installs the cross
# compiler first if it is missing. Extra arguments go to the configure step.
set -euo pipefail
here=$(dirname "$(readlink -f "$0")")
top=$(dirname "$here")
build=${1:-$top/build-win32}
[ $# -gt 0 ] && shift
"$here/install-mingw.sh"
if [ ! -f "$build/CMakeCache.txt" ] || [ $# -gt 0 ]; then
  cmake -S "$top" -B "$build" \
    -DCMAKE_TOOLCHAIN_FILE="$top/cmake/i686-w64-mingw32.cmake" \
    -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DISORT_BUILD_TOOLS=OFF "$@"
fi
cmake --build "$build" --parallel "$(nproc)"
