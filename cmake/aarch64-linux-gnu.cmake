# Cross build for the device with Debian's aarch64-linux-gnu toolchain
# (g++-aarch64-linux-gnu). The binaries run on the build machine under
# qemu-user, which finds the target's libraries in the cross sysroot.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)

set(CMAKE_C_COMPILER aarch64-linux-gnu-gcc)
set(CMAKE_CXX_COMPILER aarch64-linux-gnu-g++)

set(MIGRATE_SETTINGS_SYSROOT /usr/aarch64-linux-gnu)

# Libraries, headers and packages of the target only; programs of the host.
set(CMAKE_FIND_ROOT_PATH ${MIGRATE_SETTINGS_SYSROOT})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

find_program(MIGRATE_SETTINGS_QEMU qemu-aarch64)
if(MIGRATE_SETTINGS_QEMU)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${MIGRATE_SETTINGS_QEMU} -L ${MIGRATE_SETTINGS_SYSROOT})
endif()
