# 32-bit ARM (Android's armeabi-v7a ABI: ARMv7-A with VFP, Thumb-2) with
# Debian's armhf cross compiler (g++-arm-linux-gnueabihf); tests run under
# qemu-arm. See DebianCross.cmake.
set(TESSARINE_CROSS_TRIPLE arm-linux-gnueabihf)
set(TESSARINE_CROSS_PROCESSOR armv7-a)
set(TESSARINE_CROSS_QEMU qemu-arm)
include(${CMAKE_CURRENT_LIST_DIR}/DebianCross.cmake)
