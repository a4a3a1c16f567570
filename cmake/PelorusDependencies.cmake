find_package(Threads REQUIRED)

# The three libraries that a firmware can update on its own; all linked dynamically. With
# PELORUS_HEADERS_ONLY only their headers are used: the unit tests' fakes replace every call.
if(PELORUS_HEADERS_ONLY)
  find_path(CURL_INCLUDE_DIR curl/curl.h PATH_SUFFIXES x86_64-linux-gnu REQUIRED)
  add_library(CURL::libcurl INTERFACE IMPORTED)
  target_include_directories(CURL::libcurl SYSTEM INTERFACE ${CURL_INCLUDE_DIR})
else()
  find_package(CURL REQUIRED)
endif()

function(pelorus_import name header library)
  find_path(${name}_INCLUDE_DIR ${header} REQUIRED)
  add_library(pelorus_${name} INTERFACE)
  target_include_directories(pelorus_${name} SYSTEM INTERFACE ${${name}_INCLUDE_DIR})
  mark_as_advanced(${name}_INCLUDE_DIR ${name}_LIBRARY)
  if(NOT PELORUS_HEADERS_ONLY)
    find_library(${name}_LIBRARY ${library} REQUIRED)
    target_link_libraries(pelorus_${name} INTERFACE ${${name}_LIBRARY})
  endif()
endfunction()

pelorus_import(miniupnpc miniupnpc/miniupnpc.h miniupnpc)
pelorus_import(natpmp natpmp.h natpmp)

# Header only; what is printed by pelorus-doctor --json.
find_path(nlohmann_json_INCLUDE_DIR nlohmann/json.hpp REQUIRED)
mark_as_advanced(nlohmann_json_INCLUDE_DIR)
add_library(pelorus_json INTERFACE)
target_include_directories(pelorus_json SYSTEM INTERFACE ${nlohmann_json_INCLUDE_DIR})

# For compressed logs. The unit tests do not replace it: for another word size it has to be there.
if(PELORUS_HEADERS_ONLY)
  add_library(ZLIB::ZLIB INTERFACE IMPORTED)
  target_link_libraries(ZLIB::ZLIB INTERFACE z)
else()
  find_package(ZLIB REQUIRED)
endif()

# The device's structured event log; a build host rarely has it.
add_library(pelorus_qvlog INTERFACE)
if(NOT PELORUS_QVLOG STREQUAL "BUNDLED")
  find_path(QVLOG_INCLUDE_DIR qvlog.h)
  find_library(QVLOG_LIBRARY qvlog)
  mark_as_advanced(QVLOG_INCLUDE_DIR QVLOG_LIBRARY)
endif()
if(QVLOG_INCLUDE_DIR AND QVLOG_LIBRARY)
  target_include_directories(pelorus_qvlog SYSTEM INTERFACE ${QVLOG_INCLUDE_DIR})
  target_link_libraries(pelorus_qvlog INTERFACE ${QVLOG_LIBRARY})
elseif(PELORUS_QVLOG STREQUAL "SYSTEM")
  message(FATAL_ERROR "PELORUS_QVLOG=SYSTEM, but qvlog.h or libqvlog was not found")
else()
  add_subdirectory(${CMAKE_CURRENT_SOURCE_DIR}/src/common/qvlog)
  target_link_libraries(pelorus_qvlog INTERFACE qvlog)
endif()
