# Cross build for 64-bit Windows with Debian's mingw-w64 (the posix thread
# model, so std::thread and std::mutex work), run under Wine on Linux.
#
#   scripts/windows-deps
#   cmake -S . -B build/windows -G Ninja \
#     -DCMAKE_TOOLCHAIN_FILE=cmake/toolchains/mingw-w64-x86_64.cmake
#
# scripts/windows-deps installs the compilers and Wine, builds GoogleTest,
# tinyxml2, libpng and libsndfile for Windows into PM_MINGW_DEPS, copies the
# JSON and CLI11 headers there and makes the Wine prefix PM_WINEPREFIX. Both
# default to folders under ${XDG_CACHE_HOME:-$HOME/.cache}/pm-ndisource and
# follow the environment variables of the same names, as in the script.
#
# Executables and DLLs import the compiler's C++ runtime DLLs, which the
# build copies beside them (see below). Tests run through CMAKE_CROSSCOMPILING_EMULATOR (Wine), so ctest and
# gtest_discover_tests work as in a native build.

set(CMAKE_SYSTEM_NAME Windows)
set(CMAKE_SYSTEM_PROCESSOR AMD64)

set(PM_MINGW_TRIPLE x86_64-w64-mingw32)
set(CMAKE_C_COMPILER ${PM_MINGW_TRIPLE}-gcc-posix)
set(CMAKE_CXX_COMPILER ${PM_MINGW_TRIPLE}-g++-posix)
set(CMAKE_RC_COMPILER ${PM_MINGW_TRIPLE}-windres)

# The cache folders; try_compile projects read this file again, so they are
# computed the same way there (and passed on explicitly).
if(DEFINED ENV{XDG_CACHE_HOME} AND NOT "$ENV{XDG_CACHE_HOME}" STREQUAL "")
  set(_pm_cache "$ENV{XDG_CACHE_HOME}/pm-ndisource")
else()
  set(_pm_cache "$ENV{HOME}/.cache/pm-ndisource")
endif()
# _pm_cache_folder(VAR SUBFOLDER DOC): VAR as given on the command line, else
# from the environment variable VAR, else the cache's SUBFOLDER.
macro(_pm_cache_folder var subfolder doc)
  if(NOT ${var})
    if(NOT "$ENV{${var}}" STREQUAL "")
      set(${var} "$ENV{${var}}")
    else()
      set(${var} "${_pm_cache}/${subfolder}")
    endif()
  endif()
  set(${var} "${${var}}" CACHE PATH "${doc}")
endmacro()
_pm_cache_folder(PM_MINGW_DEPS mingw "Windows builds of the dependencies (scripts/windows-deps)")
_pm_cache_folder(PM_WINEPREFIX wine "Wine prefix that runs the tests")
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES PM_MINGW_DEPS PM_WINEPREFIX)

# Libraries, headers and CMake packages come from the mingw sysroot and the
# dependency cache only, never from the build machine; programs (the
# compilers, pkg-config) from the build machine.
set(CMAKE_FIND_ROOT_PATH /usr/${PM_MINGW_TRIPLE} "${PM_MINGW_DEPS}")
list(APPEND CMAKE_PREFIX_PATH "${PM_MINGW_DEPS}")
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
# Debian's mingw zlib comes as an import library and a static one: the
# static one, like everything else here.
set(ZLIB_USE_STATIC_LIBS ON)
# pkg-config must not hand the build machine's .pc files to the cross build.
set(ENV{PKG_CONFIG_LIBDIR} "${PM_MINGW_DEPS}/lib/pkgconfig:${PM_MINGW_DEPS}/share/pkgconfig")
set(ENV{PKG_CONFIG_PATH} "")

# One C++ runtime for the whole process: the runner and the task module hand
# each other C++ objects (the context, dispatchers with their threads and
# locks), which works only when both use the same libstdc++ and winpthread,
# as programs built with a shared C runtime do. A runtime linked into each
# module would give each its own thread table: a thread made by the runner
# could not be joined, nor recognised, by the module. So the compiler's
# libstdc++-6.dll, libgcc_s_seh-1.dll and libwinpthread-1.dll are imported,
# and the build copies them beside the programs (PM_MINGW_RUNTIME_DLLS).
set(PM_MINGW_RUNTIME_DLLS libstdc++-6.dll libgcc_s_seh-1.dll libwinpthread-1.dll)

# Wine runs the .exe files for ctest and for gtest_discover_tests. It is not
# on PATH in Debian's wine64 package; WINEDEBUG=-all keeps its own
# diagnostics out of the tests' output.
set(CMAKE_CROSSCOMPILING_EMULATOR
  /usr/bin/env "WINEPREFIX=${PM_WINEPREFIX}" WINEDEBUG=-all /usr/lib/wine/wine64)
