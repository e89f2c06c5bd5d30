# 64-bit big-endian s390x (s390x), run under qemu-user; see kova-cross.cmake.
set(KOVA_CROSS_ARCH s390x)
set(KOVA_CROSS_TRIPLE s390x-linux-gnu)
set(KOVA_CROSS_PROCESSOR s390x)
set(KOVA_CROSS_QEMU qemu-s390x-static)
include(${CMAKE_CURRENT_LIST_DIR}/kova-cross.cmake)
