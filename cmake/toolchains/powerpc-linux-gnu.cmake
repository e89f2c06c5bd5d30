# 32-bit big-endian PowerPC (powerpc), run under qemu-user; see kova-cross.cmake.
set(KOVA_CROSS_ARCH powerpc)
set(KOVA_CROSS_TRIPLE powerpc-linux-gnu)
set(KOVA_CROSS_PROCESSOR powerpc)
set(KOVA_CROSS_QEMU qemu-ppc-static)
include(${CMAKE_CURRENT_LIST_DIR}/kova-cross.cmake)
