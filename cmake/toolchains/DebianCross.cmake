# Shared part of the toolchain files for Debian's cross compilers. The file
# that includes this one sets TESSARINE_CROSS_TRIPLE (the GNU triple, which is
# also Debian's multiarch directory name), TESSARINE_CROSS_PROCESSOR and
# TESSARINE_CROSS_QEMU (the qemu-user program for that processor).
#
# Target libraries come from Debian's multiarch packages for the target
# architecture (libsqlite3-dev:<arch>, libgtest-dev:<arch>), which install
# under /usr/lib/<triple>. Programs built for the target run under qemu-user:
# CTest and GoogleTest's test discovery start them through the emulator, so no
# binfmt registration is needed. Build tools (flatc) are the build machine's.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR ${TESSARINE_CROSS_PROCESSOR})
set(CMAKE_C_COMPILER ${TESSARINE_CROSS_TRIPLE}-gcc)
set(CMAKE_CXX_COMPILER ${TESSARINE_CROSS_TRIPLE}-g++)
set(CMAKE_LIBRARY_ARCHITECTURE ${TESSARINE_CROSS_TRIPLE})

# The emulated programs load the target's C and C++ runtime from the
# multiarch packages (libc6:<arch>, libstdc++6:<arch>) in their usual places.
# The cross toolchain's own copies under /usr/<triple> are not used at run
# time (no qemu -L): their version can differ from the multiarch libc that
# SQLite's package brings, and a loader of one with a libc of the other hangs.
set(CMAKE_CROSSCOMPILING_EMULATOR ${TESSARINE_CROSS_QEMU})

# Libraries, headers and CMake packages only for the target; programs only
# from the build machine.
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
