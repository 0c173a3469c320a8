# Runs protoc with the arguments after "--" and passes on what it prints, without two notices that the schema causes by
# design: imports that a file keeps for its readers only, and files that are proto2 because they carry no syntax line.

set(command "")
set(seen_separator FALSE)
math(EXPR last "${CMAKE_ARGC} - 1")
foreach(i RANGE ${last})
    if(seen_separator)
        list(APPEND command "${CMAKE_ARGV${i}}")
    elseif(CMAKE_ARGV${i} STREQUAL "--")
        set(seen_separator TRUE)
    endif()
endforeach()

execute_process(COMMAND ${command} RESULT_VARIABLE result ERROR_VARIABLE notices)
string(REGEX REPLACE "[^\n]*warning: Import [^\n]* is unused\\.\n" "" notices "${notices}")
string(REGEX REPLACE "[^\n]*No syntax specified for the proto file:[^\n]*\n" "" notices "${notices}")
if(NOT notices STREQUAL "")
    message("${notices}")
endif()
if(NOT result EQUAL 0)
    message(FATAL_ERROR "protoc failed (${result}): ${command}")
endif()
