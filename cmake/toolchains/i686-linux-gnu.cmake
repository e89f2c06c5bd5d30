# 32-bit little-endian x86 (i386), run under qemu-user; see kova-cross.cmake.
set(KOVA_CROSS_ARCH i386)
set(KOVA_CROSS_TRIPLE i686-linux-gnu)
set(KOVA_CROSS_PROCESSOR i686)
set(KOVA_CROSS_QEMU qemu-i386-static)
include(${CMAKE_CURRENT_LIST_DIR}/kova-cross.cmake)
