# How sources are listed, everywhere in this repository: a directory is a room, and all sources in it belong to the target
# that names the room. A program's main file is no part of a room: the program names it itself.

# krutil_sources(OUT ROOM...): the sources of rooms, which are directories below the current one ("." is itself). Main
# files (main.cpp) are left out.
function(krutil_sources out)
    set(sources "")
    foreach(room IN LISTS ARGN)
        file(GLOB found CONFIGURE_DEPENDS "${CMAKE_CURRENT_SOURCE_DIR}/${room}/*.cpp")
        list(FILTER found EXCLUDE REGEX "/main\\.cpp$")
        list(APPEND sources ${found})
    endforeach()
    if(NOT sources)
        message(FATAL_ERROR "krutil_sources: no sources in ${ARGN}, below ${CMAKE_CURRENT_SOURCE_DIR}")
    endif()
    set(${out} "${sources}" PARENT_SCOPE)
endfunction()
