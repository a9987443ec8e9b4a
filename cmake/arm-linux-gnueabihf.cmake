# 32-bit ARM on Linux, with the distribution's cross compiler and a sysroot that scripts/arm-sysroot fills with the packages of
# that architecture. Programs of the target run under the user-mode emulator, so that tests run like any others.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR armv7)
set(CMAKE_CXX_COMPILER arm-linux-gnueabihf-g++)
set(CMAKE_LIBRARY_ARCHITECTURE arm-linux-gnueabihf)

if(NOT CELLAR_ARM_SYSROOT)
  get_filename_component(CELLAR_ARM_SYSROOT ${CMAKE_CURRENT_LIST_DIR}/../build/arm-sysroot ABSOLUTE)
endif()
# The trial builds that CMake makes while it looks at the compiler get it too.
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES CELLAR_ARM_SYSROOT)

set(CMAKE_FIND_ROOT_PATH ${CELLAR_ARM_SYSROOT})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

# Where the libraries are that the libraries we link need themselves, for the linker and for the emulator.
set(library_directories ${CELLAR_ARM_SYSROOT}/usr/lib/arm-linux-gnueabihf ${CELLAR_ARM_SYSROOT}/lib/arm-linux-gnueabihf)
list(JOIN library_directories ":" library_path)
set(CMAKE_EXE_LINKER_FLAGS_INIT -Wl,-rpath-link,${library_path})
set(CMAKE_SHARED_LINKER_FLAGS_INIT -Wl,-rpath-link,${library_path})
set(CMAKE_CROSSCOMPILING_EMULATOR
  qemu-arm-static -L /usr/arm-linux-gnueabihf -E LD_LIBRARY_PATH=${library_path})
# All of the target is compiled with compilers that agree on the calling convention which the notes are about.
set(CMAKE_CXX_FLAGS_INIT -Wno-psabi)
