# Read before the compiler's flags become cache entries: -O2 in place of CMake's -O3. What the user
# or a toolchain file sets stays.
string(REPLACE "-O3" "-O2" CMAKE_CXX_FLAGS_RELEASE_INIT "${CMAKE_CXX_FLAGS_RELEASE_INIT}")
