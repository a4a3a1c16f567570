# pelorus_module(NAME SOURCES a.cpp ... [DEPENDS module ...] [LINKS library ...])
#
# Each folder in src/ is a static library. Its headers are reachable only through a folder of their
# own in the build tree (modules/NAME/NAME -> src/NAME), so that #include "NAME/x.h" compiles only
# in modules that depend on NAME, directly or indirectly: an include against the direction of the
# dependencies is a build error, not a matter of review.
function(pelorus_module name)
  cmake_parse_arguments(MODULE "" "" "SOURCES;DEPENDS;LINKS" ${ARGN})
  set(include_root ${PROJECT_BINARY_DIR}/modules/${name})
  file(MAKE_DIRECTORY ${include_root})
  file(CREATE_LINK ${CMAKE_CURRENT_SOURCE_DIR} ${include_root}/${name} SYMBOLIC)

  add_library(${name} STATIC ${MODULE_SOURCES})
  add_library(pelorus::${name} ALIAS ${name})
  target_include_directories(${name} PUBLIC ${include_root})
  target_link_libraries(${name} PUBLIC ${MODULE_LINKS} PRIVATE pelorus_flags)
  foreach(dependency IN LISTS MODULE_DEPENDS)
    target_link_libraries(${name} PUBLIC pelorus::${dependency})
  endforeach()
endfunction()
