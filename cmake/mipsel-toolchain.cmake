# For the device: 32-bit little-endian MIPS Linux with the GNU C library.
#
# These two say which compiler and which headers and libraries; as they stand, Debian's compiler and
# what scripts/setup unpacks. For another device:
#   cmake --preset mipsel -DFIELDKIT_TESTS=OFF -DFIELDKIT_WERROR=OFF \
#       -DFIELDKIT_CROSS_PREFIX=... -DFIELDKIT_SYSROOT=...
set(FIELDKIT_CROSS_PREFIX mipsel-linux-gnu- CACHE STRING
  "What stands before gcc and g++ in the compilers' names, with a path where they are not in PATH")
get_filename_component(default_sysroot ${CMAKE_CURRENT_LIST_DIR}/../build/mipsel-sysroot ABSOLUTE)
set(FIELDKIT_SYSROOT ${default_sysroot} CACHE PATH
  "Folder with the device's libraries and their headers; empty for the compiler's own")
# CMake's checks of the compiler read this file as well, and have to find the same.
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES FIELDKIT_CROSS_PREFIX FIELDKIT_SYSROOT)

set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR mipsel)
set(CMAKE_C_COMPILER ${FIELDKIT_CROSS_PREFIX}gcc)
set(CMAKE_CXX_COMPILER ${FIELDKIT_CROSS_PREFIX}g++)
if(FIELDKIT_SYSROOT)
  set(CMAKE_SYSROOT ${FIELDKIT_SYSROOT})
else()
  # Where the compiler looks by itself. Without any root CMake would look among this machine's own.
  execute_process(COMMAND ${CMAKE_C_COMPILER} -print-sysroot
    OUTPUT_VARIABLE CMAKE_FIND_ROOT_PATH OUTPUT_STRIP_TRAILING_WHITESPACE)
endif()
# Where Debian has the libraries. CMake learns it from the compiler, but not in a folder with a blank.
set(CMAKE_LIBRARY_ARCHITECTURE mipsel-linux-gnu)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
