# Toolchain: 32-bit Arm (v7, hard float) with Debian's cross compiler.
set(CMAKE_SYSTEM_PROCESSOR arm)
set(PELORUS_TRIPLET arm-linux-gnueabihf)
include(${CMAKE_CURRENT_LIST_DIR}/multiarch.cmake)
