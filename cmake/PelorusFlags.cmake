# Flags of every target in the project.
#   pelorus_flags: warnings, sanitizers and, in every build type but Debug, hardening.

include(CheckCXXCompilerFlag)

add_library(pelorus_flags INTERFACE)

target_compile_options(pelorus_flags INTERFACE
  -Wall -Wextra -Wpedantic -Wshadow -Wconversion -Wsign-conversion -Wcast-align -Wcast-qual
  -Wold-style-cast -Wnon-virtual-dtor -Woverloaded-virtual -Wsuggest-override -Wextra-semi
  -Wzero-as-null-pointer-constant -Wformat=2 -Wredundant-decls -Wundef -Wvla
  -Wmissing-declarations -Wdouble-promotion)
if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  target_compile_options(pelorus_flags INTERFACE
    -Wformat-overflow=2 -Wformat-truncation=2 -Wduplicated-cond -Wduplicated-branches -Wlogical-op
    -Wunused-const-variable=2 -Wimplicit-fallthrough=5)
endif()
if(PELORUS_WERROR)
  target_compile_options(pelorus_flags INTERFACE -Werror)
endif()

if(PELORUS_SANITIZE)
  # No class is cast down its hierarchy, and vptr alone takes a quarter of a table's compile time.
  target_compile_options(pelorus_flags INTERFACE
    -fsanitize=${PELORUS_SANITIZE} -fno-sanitize=vptr -fno-sanitize-recover=all -fno-omit-frame-pointer)
  string(REPLACE "fuzzer-no-link," "" PELORUS_SANITIZE_LINK "${PELORUS_SANITIZE}")
  target_link_options(pelorus_flags INTERFACE -fsanitize=${PELORUS_SANITIZE_LINK})
elseif(NOT CMAKE_BUILD_TYPE STREQUAL "Debug")
  # Fortify does not work with the sanitizers. Distributions set another level for their packages.
  target_compile_options(pelorus_flags INTERFACE
    -U_FORTIFY_SOURCE -D_FORTIFY_SOURCE=3 -D_GLIBCXX_ASSERTIONS
    -fstack-protector-strong -fstack-clash-protection -fPIE -ffunction-sections -fdata-sections)
  check_cxx_compiler_flag(-ftrivial-auto-var-init=zero PELORUS_HAVE_AUTO_VAR_INIT)
  if(PELORUS_HAVE_AUTO_VAR_INIT)
    target_compile_options(pelorus_flags INTERFACE -ftrivial-auto-var-init=zero)
  endif()
  target_link_options(pelorus_flags INTERFACE
    -pie -Wl,-z,relro,-z,now -Wl,--gc-sections -Wl,--as-needed)
endif()
