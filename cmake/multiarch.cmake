# Rest of the toolchains arm64.cmake and armhf.cmake: libraries come from Debian's multiarch
# folders of PELORUS_TRIPLET, or from CMAKE_SYSROOT if the caller sets it; programs are the host's.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_C_COMPILER ${PELORUS_TRIPLET}-gcc)
set(CMAKE_CXX_COMPILER ${PELORUS_TRIPLET}-g++)
set(CMAKE_LIBRARY_ARCHITECTURE ${PELORUS_TRIPLET})

# Without this pkg-config names the folders of the build machine's own libcurl.
set(ENV{PKG_CONFIG_DIR} "")
set(ENV{PKG_CONFIG_LIBDIR}
  ${CMAKE_SYSROOT}/usr/lib/${PELORUS_TRIPLET}/pkgconfig:${CMAKE_SYSROOT}/usr/share/pkgconfig)
set(ENV{PKG_CONFIG_SYSROOT_DIR} "${CMAKE_SYSROOT}")
set(CMAKE_FIND_ROOT_PATH ${CMAKE_SYSROOT})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
foreach(kind LIBRARY INCLUDE PACKAGE)
  set(CMAKE_FIND_ROOT_PATH_MODE_${kind} ONLY)
endforeach()
set(CMAKE_SYSTEM_IGNORE_PREFIX_PATH /usr/local)

find_program(PELORUS_EMULATOR qemu-${CMAKE_SYSTEM_PROCESSOR}-static)
if(PELORUS_EMULATOR)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${PELORUS_EMULATOR} -L "${CMAKE_SYSROOT}/")
endif()
