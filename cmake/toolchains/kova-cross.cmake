# Shared part of the cross toolchain files: a Debian cross compiler for KOVA_CROSS_TRIPLE, the
# dependencies in a sysroot built by scripts/cross-test, and qemu-user to run what is built.
#
# The sysroot is KOVA_SYSROOT (a cache variable or the environment variable of that name),
# by default ~/.cache/kovacredential/sysroot-<arch>. Its libraries are installed under
# <sysroot>/usr with absolute paths, so that programs find them at run time through their
# RUNPATH. qemu runs programs with the sysroot as their root (-L): scripts/cross-test links
# <sysroot>/lib to the cross compiler's C library in /usr/<triple>/lib and gives the sysroot an
# empty etc/ld.so.cache. Without that file the emulated loader reads the build machine's cache,
# which names the build machine's own 32-bit x86 C library (/lib32); an i386 program then
# loads that one, of another release than its loader, and hangs in its first pthread_create.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR ${KOVA_CROSS_PROCESSOR})
set(CMAKE_C_COMPILER ${KOVA_CROSS_TRIPLE}-gcc)
set(CMAKE_CXX_COMPILER ${KOVA_CROSS_TRIPLE}-g++)

if(NOT KOVA_SYSROOT)
  if(DEFINED ENV{KOVA_SYSROOT} AND NOT "$ENV{KOVA_SYSROOT}" STREQUAL "")
    set(KOVA_SYSROOT "$ENV{KOVA_SYSROOT}")
  else()
    set(KOVA_SYSROOT "$ENV{HOME}/.cache/kovacredential/sysroot-${KOVA_CROSS_ARCH}")
  endif()
endif()
set(KOVA_SYSROOT "${KOVA_SYSROOT}" CACHE PATH "Sysroot holding the cross-built dependencies")
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES KOVA_SYSROOT)

# Appended, so that a project may add find roots of its own (a scratch install prefix).
list(APPEND CMAKE_FIND_ROOT_PATH ${KOVA_SYSROOT} /usr/${KOVA_CROSS_TRIPLE})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
# Header-only dependencies are found the way a native build finds /usr/include.
set(CMAKE_C_STANDARD_INCLUDE_DIRECTORIES ${KOVA_SYSROOT}/usr/include)
set(CMAKE_CXX_STANDARD_INCLUDE_DIRECTORIES ${KOVA_SYSROOT}/usr/include)
# Installed libraries and programs get no RUNPATH: on the target the libraries are in the
# system's folders, and qemu's -L finds them in the sysroot's.
# pkg-config sees the sysroot's .pc files only, never the build machine's.
set(ENV{PKG_CONFIG_LIBDIR} ${KOVA_SYSROOT}/usr/lib/pkgconfig)

set(CMAKE_CROSSCOMPILING_EMULATOR ${KOVA_CROSS_QEMU} -L ${KOVA_SYSROOT})
