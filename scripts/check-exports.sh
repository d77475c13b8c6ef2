#!/usr/bin/env bash
# check-exports.sh isort.dll: fails unless the DLL's exported names, less the
# C++ ones (_Z...), are exactly the Fortran-callable entries (stdcall,
# decorated as the MSVC toolchain spells them) and SrtUnpack. Also lists
# the DLLs it imports.
set -euo pipefail
[ $# -eq 1 ] || { echo "usage: ${0##*/} DLL" >&2; exit 2; }
dll=$1
objdump=${OBJDUMP:-i686-w64-mingw32-objdump}
expected="SrtUnpack _SORTFILE@44 _SRTFPK@32 _SRTFUP@28 _SRTFVA@40"

dump=$("$objdump" -p "$dll")
# Rows of the name table look like "\t[   0] +base[   1] 0000 NAME".
names=$(awk '/\[Ordinal\/Name Pointer\] Table/ { t = 1; next }
             t && /^[ \t]*\[ *[0-9]+\]/ { print $NF; next }
             t { t = 0 }' <<<"$dump")
plain=$(grep -v '^_Z' <<<"$names" | LC_ALL=C sort | tr '\n' ' ' | sed 's/ $//' || true)
want=$(tr ' ' '\n' <<<"$expected" | LC_ALL=C sort | tr '\n' ' ' | sed 's/ $//')

echo "exports of $dll (C++ names left out): $plain"
echo "$(grep -c '^_Z' <<<"$names" || true) C++ exports"
echo "imports: $(awk '/DLL Name:/ { printf "%s ", $3 }' <<<"$dump")"
if [ "$plain" != "$want" ]; then
  echo "check-exports: FAIL: expected exactly: $want" >&2
  exit 1
fi
echo "check-exports: OK"
