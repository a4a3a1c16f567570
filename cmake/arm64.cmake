# Toolchain: 64-bit Arm with Debian's cross compiler.
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(PELORUS_TRIPLET aarch64-linux-gnu)
include(${CMAKE_CURRENT_LIST_DIR}/multiarch.cmake)
