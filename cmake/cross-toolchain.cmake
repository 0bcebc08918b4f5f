# Cross-building btbus for the appliance (or any Linux target) with a GNU
# toolchain and a sysroot that holds the target's libraries and their
# pkg-config files:
#   cmake -S . -B build-target -DCMAKE_TOOLCHAIN_FILE=cmake/cross-toolchain.cmake \
#         -DBTBUS_SYSROOT=/path/to/sysroot -DBTBUS_CROSS_PREFIX=powerpc-linux-gnu-
# BTBUS_CROSS_PREFIX is what comes before gcc, g++ and ar: a triplet with a
# dash, or a full path (/opt/sdk/bin/powerpc-poky-linux-). Nothing here depends
# on what the SDK calls the processor. BTBUS_EMULATOR, when given, runs target
# programs for the tests (a list: the emulator and its arguments).
set(BTBUS_SYSROOT "" CACHE PATH "The target's root: its libraries, headers and pkg-config files")
set(BTBUS_CROSS_PREFIX "" CACHE STRING "What comes before gcc, g++ and ar (a triplet and a dash, or a path)")
set(BTBUS_EMULATOR "" CACHE STRING "Runs target programs on this machine, for the tests")
if(NOT BTBUS_SYSROOT OR NOT BTBUS_CROSS_PREFIX)
  message(FATAL_ERROR "cross-toolchain.cmake needs -DBTBUS_SYSROOT=... and -DBTBUS_CROSS_PREFIX=...")
endif()
# try_compile projects see the same settings.
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES BTBUS_SYSROOT BTBUS_CROSS_PREFIX BTBUS_EMULATOR)

set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_C_COMPILER ${BTBUS_CROSS_PREFIX}gcc)
set(CMAKE_CXX_COMPILER ${BTBUS_CROSS_PREFIX}g++)
set(CMAKE_AR ${BTBUS_CROSS_PREFIX}ar CACHE FILEPATH "")
execute_process(COMMAND ${CMAKE_CXX_COMPILER} -dumpmachine OUTPUT_VARIABLE BTBUS_TARGET
                OUTPUT_STRIP_TRAILING_WHITESPACE)
string(REGEX REPLACE "-.*" "" CMAKE_SYSTEM_PROCESSOR "${BTBUS_TARGET}")

set(CMAKE_SYSROOT ${BTBUS_SYSROOT})
set(CMAKE_FIND_ROOT_PATH ${BTBUS_SYSROOT})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
# A toolchain whose compiler keeps its C library outside the sysroot (Debian's
# cross compilers) does not search the sysroot's include directory by itself;
# searched last, it changes nothing for a compiler that does.
set(CMAKE_C_FLAGS_INIT "-idirafter ${BTBUS_SYSROOT}/usr/include")
set(CMAKE_CXX_FLAGS_INIT "-idirafter ${BTBUS_SYSROOT}/usr/include")
foreach(kind EXE SHARED MODULE)
  set(CMAKE_${kind}_LINKER_FLAGS_INIT "-Wl,-rpath-link,${BTBUS_SYSROOT}/usr/lib -Wl,-rpath-link,${BTBUS_SYSROOT}/lib")
endforeach()

# pkg-config reads the target's files, and prefixes their paths with the sysroot.
set(ENV{PKG_CONFIG_SYSROOT_DIR} ${BTBUS_SYSROOT})
set(ENV{PKG_CONFIG_LIBDIR} "${BTBUS_SYSROOT}/usr/lib/pkgconfig:${BTBUS_SYSROOT}/usr/share/pkgconfig")
set(ENV{PKG_CONFIG_PATH} "")
if(BTBUS_EMULATOR)
  # By its full path: the session bus starts services without searching PATH.
  set(emulator ${BTBUS_EMULATOR})
  list(GET emulator 0 program)
  find_program(BTBUS_EMULATOR_PROGRAM ${program} NO_CMAKE_FIND_ROOT_PATH)
  list(REMOVE_AT emulator 0)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${BTBUS_EMULATOR_PROGRAM} ${emulator})
endif()
