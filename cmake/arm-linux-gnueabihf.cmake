# 32-bit ARM: see linux-cross.cmake.
set(CMAKE_SYSTEM_PROCESSOR armv7)
set(CELLAR_TRIPLET arm-linux-gnueabihf)
set(CELLAR_SYSROOT arm-sysroot)
set(CELLAR_EMULATOR qemu-arm-static)
set(CELLAR_LINKER_FLAGS "")
include(${CMAKE_CURRENT_LIST_DIR}/linux-cross.cmake)
# All of the target is compiled with compilers that agree on the calling convention which the notes are about.
set(CMAKE_CXX_FLAGS_INIT -Wno-psabi)
