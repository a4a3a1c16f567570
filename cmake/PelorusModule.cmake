# pelorus_room(NAME SOURCES a.cpp ... [SEES room ...] [LINKS library ...])
#
# One folder below src/ is one static library. Its headers are reachable only through a folder of
# its own in the build tree (rooms/NAME/NAME -> src/NAME), so "#include "NAME/x.h"" compiles only
# in a room that names NAME under SEES: a dependency against the direction of the house is a build
# error, not a matter of review.
function(pelorus_room name)
  cmake_parse_arguments(ROOM "" "" "SOURCES;SEES;LINKS" ${ARGN})
  set(doorway ${PROJECT_BINARY_DIR}/rooms/${name})
  file(MAKE_DIRECTORY ${doorway})
  file(CREATE_LINK ${CMAKE_CURRENT_SOURCE_DIR} ${doorway}/${name} SYMBOLIC)

  add_library(${name} STATIC ${ROOM_SOURCES})
  add_library(pelorus::${name} ALIAS ${name})
  target_include_directories(${name} PUBLIC ${doorway})
  target_link_libraries(${name} PUBLIC ${ROOM_LINKS} PRIVATE pelorus_flags)
  foreach(seen IN LISTS ROOM_SEES)
    target_link_libraries(${name} PUBLIC pelorus::${seen})
  endforeach()
endfunction()
