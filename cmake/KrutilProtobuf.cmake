# krutil_generate_messages(OUT DIRECTORY [EXPORT_MACRO NAME] [IMPORTS DIRECTORY...] PROTOS FILE...)
#
# Generates C++ message classes from schema files into DIRECTORY and returns the list of generated sources in the variable
# OUT. EXPORT_MACRO marks the classes and enum helpers for export from a shared library. IMPORTS are further directories
# in which imported files are found.
#
# The target krutil_generated_code makes all of it without compiling it.

find_package(Protobuf 3.6 REQUIRED)

function(krutil_generate_messages out directory)
    cmake_parse_arguments(arg "" "EXPORT_MACRO" "IMPORTS;PROTOS" ${ARGN})
    file(MAKE_DIRECTORY "${directory}")
    set(plugin_options "")
    if(arg_EXPORT_MACRO)
        set(plugin_options "dllexport_decl=${arg_EXPORT_MACRO}:")
    endif()
    set(generated "")
    foreach(proto IN LISTS arg_PROTOS)
        cmake_path(GET proto PARENT_PATH proto_directory)
        cmake_path(GET proto STEM LAST_ONLY stem)
        set(include_options "-I${proto_directory}")
        foreach(import IN LISTS arg_IMPORTS)
            list(APPEND include_options "-I${import}")
        endforeach()
        add_custom_command(
            OUTPUT "${directory}/${stem}.pb.cc" "${directory}/${stem}.pb.h"
            COMMAND ${CMAKE_COMMAND} -P "${CMAKE_CURRENT_FUNCTION_LIST_DIR}/RunProtoc.cmake" -- $<TARGET_FILE:protobuf::protoc>
                    ${include_options} "--cpp_out=${plugin_options}${directory}" "${proto}"
            DEPENDS "${proto}" "${CMAKE_CURRENT_FUNCTION_LIST_DIR}/RunProtoc.cmake"
            COMMENT "Generating messages of ${stem}.proto"
            VERBATIM)
        list(APPEND generated "${directory}/${stem}.pb.cc" "${directory}/${stem}.pb.h")
    endforeach()
    add_custom_target(${out}_generated DEPENDS ${generated})
    if(NOT TARGET krutil_generated_code)
        add_custom_target(krutil_generated_code)
    endif()
    add_dependencies(krutil_generated_code ${out}_generated)
    set(${out} "${generated}" PARENT_SCOPE)
endfunction()
