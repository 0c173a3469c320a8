# What `cmake --install` lays out below its prefix:
#
#   bin/                                   krutil, krutil-qvm
#   lib/                                   libkrutil_protobuf.so, libkrutil_platform.so
#   lib/cmake/krutil_{protobuf,platform}/  find_package(krutil_protobuf CONFIG): krutil::protobuf, krutil::platform
#   lib/pkgconfig/                         krutil_protobuf.pc, krutil_platform.pc
#   include/krutil_{protobuf,platform}/    headers, generated message classes beside them
#   share/krutil_{protobuf,platform}/proto the schema
#   share/man/, share/bash-completion/, share/zsh/, share/fish/
#                                          manual pages and completions
#
# Nothing in it holds the prefix: the tree may be installed to one place and used from another.

option(KRUTIL_INSTALL "Generate install rules" ${PROJECT_IS_TOP_LEVEL})
if(NOT KRUTIL_INSTALL)
    return()
endif()

include(CMakePackageConfigHelpers)

# krutil_install_library(NAME SUMMARY): the library target krutil_NAME and all that its users need.
function(krutil_install_library name summary)
    cmake_parse_arguments(arg "" "REQUIRES;CFLAGS" "HEADER_DIRECTORIES;PROTO_DIRECTORIES" ${ARGN})
    set(package krutil_${name})
    set_target_properties(${package} PROPERTIES INSTALL_RPATH "$ORIGIN")
    install(TARGETS ${package} EXPORT ${package}Targets LIBRARY)
    foreach(directory IN LISTS arg_HEADER_DIRECTORIES)
        install(DIRECTORY "${directory}/" DESTINATION "${CMAKE_INSTALL_INCLUDEDIR}/${package}"
                FILES_MATCHING PATTERN "*.hpp" PATTERN "*.pb.h")
    endforeach()
    foreach(directory IN LISTS arg_PROTO_DIRECTORIES)
        install(DIRECTORY "${directory}/" DESTINATION "${CMAKE_INSTALL_DATADIR}/${package}/proto"
                FILES_MATCHING PATTERN "*.proto")
    endforeach()

    set(config_directory "${CMAKE_INSTALL_LIBDIR}/cmake/${package}")
    install(EXPORT ${package}Targets NAMESPACE krutil:: DESTINATION "${config_directory}")
    configure_package_config_file("${PROJECT_SOURCE_DIR}/cmake/${package}Config.cmake.in"
        "${PROJECT_BINARY_DIR}/${package}Config.cmake" INSTALL_DESTINATION "${config_directory}"
        NO_SET_AND_CHECK_MACRO)
    write_basic_package_version_file("${PROJECT_BINARY_DIR}/${package}ConfigVersion.cmake"
        COMPATIBILITY SameMinorVersion)
    install(FILES "${PROJECT_BINARY_DIR}/${package}Config.cmake" "${PROJECT_BINARY_DIR}/${package}ConfigVersion.cmake"
            DESTINATION "${config_directory}")

    set(pkgconfig_directory "${CMAKE_INSTALL_PREFIX}/${CMAKE_INSTALL_LIBDIR}/pkgconfig")
    cmake_path(RELATIVE_PATH CMAKE_INSTALL_PREFIX BASE_DIRECTORY "${pkgconfig_directory}" OUTPUT_VARIABLE pc_to_prefix)
    set(pc_name "${package}")
    set(pc_summary "${summary}")
    set(pc_requires "${arg_REQUIRES}")
    set(pc_cflags "${arg_CFLAGS}")
    configure_file("${PROJECT_SOURCE_DIR}/cmake/package.pc.in" "${PROJECT_BINARY_DIR}/${package}.pc" @ONLY)
    install(FILES "${PROJECT_BINARY_DIR}/${package}.pc" DESTINATION "${CMAKE_INSTALL_LIBDIR}/pkgconfig")
endfunction()

if(KRUTIL_BUILD_PLATFORM)
    krutil_install_library(platform "Reference host platform of the krutil protocol"
        REQUIRES "protobuf >= 3.6"
        HEADER_DIRECTORIES "${PROJECT_SOURCE_DIR}/platform/include" "${PROJECT_BINARY_DIR}/platform/proto_generated"
        PROTO_DIRECTORIES "${PROJECT_SOURCE_DIR}/platform/proto")
endif()

krutil_install_library(protobuf "${PROJECT_DESCRIPTION}"
    REQUIRES "krutil_platform, protobuf >= 3.6"
    CFLAGS "-DKRUTIL_PROTOBUF_EXPORT="
    HEADER_DIRECTORIES "${PROJECT_BINARY_DIR}/proto_generated"
    PROTO_DIRECTORIES "${PROJECT_SOURCE_DIR}/src/qvm_services/krutil_protobuf/proto")
install(FILES "${PROJECT_SOURCE_DIR}/src/qvm_services/krutil_protobuf/KrutilProtocol.hpp"
        DESTINATION "${CMAKE_INSTALL_INCLUDEDIR}/krutil_protobuf")

cmake_path(RELATIVE_PATH CMAKE_INSTALL_FULL_LIBDIR BASE_DIRECTORY "${CMAKE_INSTALL_FULL_BINDIR}"
           OUTPUT_VARIABLE programs_to_libraries)
foreach(program IN ITEMS krutil_client krutil-qvm)
    if(TARGET ${program})
        set_target_properties(${program} PROPERTIES INSTALL_RPATH "$ORIGIN/${programs_to_libraries}")
        install(TARGETS ${program} RUNTIME)
    endif()
endforeach()

if(TARGET krutil_manuals)
    set(made "${PROJECT_BINARY_DIR}/apps/manuals/made")
    install(FILES "${made}/krutil.1" "${made}/krutil-qvm.1" DESTINATION "${CMAKE_INSTALL_MANDIR}/man1")
    install(FILES "${made}/krutil-protocol.7" DESTINATION "${CMAKE_INSTALL_MANDIR}/man7")
    foreach(program IN ITEMS krutil krutil-qvm)
        install(FILES "${made}/${program}.bash" RENAME "${program}"
                DESTINATION "${CMAKE_INSTALL_DATADIR}/bash-completion/completions")
        install(FILES "${made}/_${program}" DESTINATION "${CMAKE_INSTALL_DATADIR}/zsh/site-functions")
        install(FILES "${made}/${program}.fish" DESTINATION "${CMAKE_INSTALL_DATADIR}/fish/vendor_completions.d")
    endforeach()
endif()
