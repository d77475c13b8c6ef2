#!/usr/bin/env bash
# Installs the mingw-w64 i686 cross compilers with the posix thread model
# (std::thread/std::mutex need it; GoogleTest needs std::mutex), and the
# Fortran one for the Fortran callers. Quick when they are already present.
set -euo pipefail
. "$(dirname "$(readlink -f "$0")")/apt-ensure.sh"
apt_ensure g++-mingw-w64-i686-posix gfortran-mingw-w64-i686-posix
command -v i686-w64-mingw32-g++-posix >/dev/null
