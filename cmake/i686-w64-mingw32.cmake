# Cross-build for 32-bit Windows with Debian's mingw-w64 compilers
# (scripts/install-mingw.sh installs them). The -posix variants: the default
# win32 thread model has no std::thread or std::mutex.
set(CMAKE_SYSTEM_NAME Windows)
set(CMAKE_SYSTEM_PROCESSOR i686)

set(_isort_mingw i686-w64-mingw32)
set(CMAKE_C_COMPILER   ${_isort_mingw}-gcc-posix)
set(CMAKE_CXX_COMPILER ${_isort_mingw}-g++-posix)
find_program(_isort_mingw_fortran ${_isort_mingw}-gfortran-posix NO_CACHE)
if(_isort_mingw_fortran)
  set(CMAKE_Fortran_COMPILER ${_isort_mingw_fortran})
endif()
set(CMAKE_RC_COMPILER ${_isort_mingw}-windres)

set(CMAKE_FIND_ROOT_PATH /usr/${_isort_mingw})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

# ctest runs the Windows programs under wine, in a 32-bit root of its own.
set(CMAKE_CROSSCOMPILING_EMULATOR ${CMAKE_CURRENT_LIST_DIR}/../scripts/wine-run.sh)
