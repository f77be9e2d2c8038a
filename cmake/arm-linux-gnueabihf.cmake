# Cross-compilation for 32-bit ARM (Debian's armhf); programs run under user-mode emulation.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR arm)
set(CMAKE_C_COMPILER arm-linux-gnueabihf-gcc)
set(CMAKE_CXX_COMPILER arm-linux-gnueabihf-g++)
set(CMAKE_LIBRARY_ARCHITECTURE arm-linux-gnueabihf)
# No prefix (-L): the emulator would look up every path in it first, even "/".
set(CMAKE_CROSSCOMPILING_EMULATOR qemu-arm)

# Libraries come from a sysroot (CMAKE_SYSROOT, see script/debian-root) or else from Debian's
# foreign-architecture packages, whose headers and package files are shared.
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
if(CMAKE_SYSROOT)
  set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
  set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
  set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
endif()
