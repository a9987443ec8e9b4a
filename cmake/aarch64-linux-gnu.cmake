# 64-bit ARM: see linux-cross.cmake.
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(CELLAR_TRIPLET aarch64-linux-gnu)
set(CELLAR_SYSROOT arm64-sysroot)
set(CELLAR_EMULATOR qemu-aarch64-static)
# As for Android, whose devices may have pages of 16 KiB.
set(CELLAR_LINKER_FLAGS "-Wl,-z,max-page-size=16384")
include(${CMAKE_CURRENT_LIST_DIR}/linux-cross.cmake)
