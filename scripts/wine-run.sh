#!/usr/bin/env bash
# wine-run.sh PROGRAM.exe [ARGS...]: runs a 32-bit Windows console program
# under the wine of the root that wine-root.sh builds (building it first if
# needed), headless, in the current directory, and exits with its exit code.
# Used as CMAKE_CROSSCOMPILING_EMULATOR, so ctest runs the Windows tests;
# several may run at once.
#
# The program's build tree, that tree's source directory, the current
# directory and the directories listed in ISORT_WINE_BIND (colon-separated)
# are bind-mounted at the same paths inside the root, so that programs and
# their files are used in place. Arguments are passed as they are: a path
# handed to the program is a Unix path, which Windows code reaches as Z:\...
set -euo pipefail
here=$(dirname "$(readlink -f "$0")")
. "$here/wine-common.sh"

[ $# -ge 1 ] || { echo "usage: ${0##*/} PROGRAM.exe [ARGS...]" >&2; exit 2; }
wine_need_root
prog=$(realpath -e -- "$1") || wine_die "no such program: $1"
shift
[ -e "$WINE_READY" ] || "$here/wine-root.sh" >&2

# Directories to bind: the program's build tree (the nearest directory up
# with a CMakeCache.txt, else the program's own) and its source directory.
dirs=()
d=$(dirname "$prog")
while [ "$d" != / ] && [ ! -f "$d/CMakeCache.txt" ]; do d=$(dirname "$d"); done
if [ "$d" = / ]; then
  dirs+=("$(dirname "$prog")")
else
  dirs+=("$d")
  src=$(sed -n 's/^CMAKE_HOME_DIRECTORY:INTERNAL=//p' "$d/CMakeCache.txt")
  [ -n "$src" ] && [ -d "$src" ] && dirs+=("$(realpath "$src")")
fi
dirs+=("$(pwd -P)")
IFS=: read -r -a extra <<<"${ISORT_WINE_BIND:-}"
for e in "${extra[@]}"; do [ -n "$e" ] && dirs+=("$(realpath -e -- "$e")"); done

# Where the program's DLLs are found besides its own directory: every
# directory of the build tree that holds a DLL, and the cross compiler's
# runtime DLLs (for programs linked against the shared C++ runtime).
dll_dirs=()
if [ -f "$d/CMakeCache.txt" ]; then
  mapfile -t dll_dirs < <(find "$d" -name CMakeFiles -prune -o -name '*.dll' -printf '%h\n' | sort -u)
fi
for f in libstdc++-6.dll libwinpthread-1.dll; do
  f=$(i686-w64-mingw32-g++-posix -print-file-name="$f" 2>/dev/null) || continue
  [ -f "$f" ] && dll_dirs+=("$(dirname "$(realpath "$f")")") && dirs+=("$(dirname "$(realpath "$f")")")
done
winepath=
for p in "${dll_dirs[@]}"; do winepath+="${winepath:+;}Z:${p//\//\\}"; done

# Keep only the outermost directories; refuse any that contains the root.
mapfile -t dirs < <(printf '%s\n' "${dirs[@]}" | sort -u)
binds=()
for d in "${dirs[@]}"; do
  case "$ISORT_WINE_ROOT/" in "${d%/}/"*) wine_die "cannot bind $d: it contains the wine root" ;; esac
  covered=
  for b in "${binds[@]}"; do case "$d/" in "$b/"*) covered=1 ;; esac; done
  [ -n "$covered" ] || binds+=("$d")
done

{
  flock 9
  wine_ensure_exec
  wine_mount_proc
  wine_bind /dev "$ISORT_WINE_ROOT/dev"
  for b in "${binds[@]}"; do wine_bind "$b" "$ISORT_WINE_ROOT$b"; done
  # One wine server, kept alive between programs, so that wine boots (starts
  # its services) once rather than for every test. Its services must not
  # inherit our output (ctest reads a test's output to the end), nor the lock.
  if wine_in_root wineserver -p"$WINE_SERVER_LINGER" </dev/null >/dev/null 2>&1 9>&-; then
    wine_in_root wine cmd /c exit 0 </dev/null >/dev/null 2>&1 9>&- || true
  fi
} 9>"$WINE_LOCK"

exec chroot "$ISORT_WINE_ROOT" env -i -C "$(pwd -P)" PATH=/usr/bin:/bin HOME=/root LC_ALL=C \
  WINEDEBUG=-all WINEPREFIX="$WINE_PREFIX_IN_ROOT" WINEDLLOVERRIDES="$WINE_DLL_OVERRIDES" \
  WINEPATH="$winepath" wine "$prog" "$@"
