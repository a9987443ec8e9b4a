# Another architecture on Linux, with the distribution's cross compiler and a sysroot that scripts/arm-sysroot fills with the
# packages of that architecture. Programs of the target run under the user-mode emulator, so that tests run like any others.
# What includes this has set: CELLAR_TRIPLET, CELLAR_SYSROOT (its directory in build/), CELLAR_EMULATOR and CELLAR_LINKER_FLAGS.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_CXX_COMPILER ${CELLAR_TRIPLET}-g++)
set(CMAKE_LIBRARY_ARCHITECTURE ${CELLAR_TRIPLET})

if(NOT CELLAR_ARM_SYSROOT)
  get_filename_component(CELLAR_ARM_SYSROOT ${CMAKE_CURRENT_LIST_DIR}/../build/${CELLAR_SYSROOT} ABSOLUTE)
endif()
# The trial builds that CMake makes while it looks at the compiler get it too.
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES CELLAR_ARM_SYSROOT)

set(CMAKE_FIND_ROOT_PATH ${CELLAR_ARM_SYSROOT})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

# Where the libraries are that the libraries we link need themselves, for the linker and for the emulator.
set(library_directories ${CELLAR_ARM_SYSROOT}/usr/lib/${CELLAR_TRIPLET} ${CELLAR_ARM_SYSROOT}/lib/${CELLAR_TRIPLET})
list(JOIN library_directories ":" library_path)
set(CMAKE_EXE_LINKER_FLAGS_INIT "-Wl,-rpath-link,${library_path} ${CELLAR_LINKER_FLAGS}")
set(CMAKE_SHARED_LINKER_FLAGS_INIT "-Wl,-rpath-link,${library_path} ${CELLAR_LINKER_FLAGS}")
set(CMAKE_CROSSCOMPILING_EMULATOR
  ${CELLAR_EMULATOR} -L /usr/${CELLAR_TRIPLET} -E LD_LIBRARY_PATH=${library_path})
