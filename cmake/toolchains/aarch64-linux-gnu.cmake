# 64-bit ARM (Android's arm64-v8a ABI) with Debian's cross compiler
# (g++-aarch64-linux-gnu); tests run under qemu-aarch64. See DebianCross.cmake.
set(TESSARINE_CROSS_TRIPLE aarch64-linux-gnu)
set(TESSARINE_CROSS_PROCESSOR aarch64)
set(TESSARINE_CROSS_QEMU qemu-aarch64)
include(${CMAKE_CURRENT_LIST_DIR}/DebianCross.cmake)
