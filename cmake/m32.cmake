# Toolchain: 32-bit code from the machine's own g++ (package g++-multilib). No 32-bit library is
# needed besides libc, libstdc++ and zlib (lib32z1-dev): the unit tests use only the headers of
# libcurl, miniupnpc and libnatpmp.
set(CMAKE_C_FLAGS_INIT -m32)
set(CMAKE_CXX_FLAGS_INIT -m32)
