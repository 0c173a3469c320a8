# What `cmake --install` lays out below its prefix, and the component that each part belongs to:
#
#   bin/                                   tools              krutil, krutil-qvm
#   lib/                                   library, platform  libkrutil_protobuf.so, libkrutil_platform.so
#   lib/cmake/krutil_{protobuf,platform}/                     find_package(krutil_protobuf CONFIG)
#   lib/pkgconfig/                                            krutil_protobuf.pc, krutil_platform.pc
#   include/krutil_{protobuf,platform}/                       headers, generated message classes beside them
#   share/krutil_{protobuf,platform}/proto schema             the schema
#   share/krutil_protobuf/                                    krutil_protobuf.desc, the same as a descriptor set
#   share/krutil/                          tools              the schema of what krutil --json prints
#   share/man/, share/bash-completion/, share/zsh/, share/fish/
#                                          tools              manual pages and completions
#   lib/wireshark/plugins/, share/wireshark/protobuf/
#                                          tools              dissector, and the schema where Wireshark looks for it
#
# find_package() knows the same components. Nothing in the tree holds the prefix: it may be installed to one place and used
# from another.

option(KRUTIL_INSTALL "Generate install rules" ${PROJECT_IS_TOP_LEVEL})
if(NOT KRUTIL_INSTALL)
    return()
endif()

include(CMakePackageConfigHelpers)

# krutil_install_library(NAME COMPONENT SUMMARY): the library target krutil_NAME and all that its users need.
function(krutil_install_library name component summary)
    cmake_parse_arguments(arg "" "REQUIRES;REQUIRES_PRIVATE;CFLAGS" "HEADER_DIRECTORIES;PC_VARIABLES" ${ARGN})
    set(package krutil_${name})
    set_target_properties(${package} PROPERTIES INSTALL_RPATH "$ORIGIN")
    install(TARGETS ${package} EXPORT ${package}Targets LIBRARY COMPONENT ${component})
    foreach(directory IN LISTS arg_HEADER_DIRECTORIES)
        install(DIRECTORY "${directory}/" DESTINATION "${CMAKE_INSTALL_INCLUDEDIR}/${package}" COMPONENT ${component}
                FILES_MATCHING PATTERN "*.hpp" PATTERN "*.pb.h")
    endforeach()
    install(EXPORT ${package}Targets NAMESPACE krutil:: DESTINATION "${CMAKE_INSTALL_LIBDIR}/cmake/${package}"
            COMPONENT ${component})

    set(pkgconfig_directory "${CMAKE_INSTALL_PREFIX}/${CMAKE_INSTALL_LIBDIR}/pkgconfig")
    cmake_path(RELATIVE_PATH CMAKE_INSTALL_PREFIX BASE_DIRECTORY "${pkgconfig_directory}" OUTPUT_VARIABLE pc_to_prefix)
    set(pc_name "${package}")
    set(pc_summary "${summary}")
    set(pc_requires "${arg_REQUIRES}")
    set(pc_requires_private "${arg_REQUIRES_PRIVATE}")
    set(pc_cflags "${arg_CFLAGS}")
    list(JOIN arg_PC_VARIABLES "\n" pc_variables)
    configure_file("${PROJECT_SOURCE_DIR}/cmake/package.pc.in" "${PROJECT_BINARY_DIR}/${package}.pc" @ONLY)
    install(FILES "${PROJECT_BINARY_DIR}/${package}.pc" DESTINATION "${CMAKE_INSTALL_LIBDIR}/pkgconfig"
            COMPONENT ${component})
endfunction()

# krutil_install_config(PACKAGE COMPONENT...): what find_package() reads first; each of the components needs it.
function(krutil_install_config package)
    set(directory "${CMAKE_INSTALL_LIBDIR}/cmake/${package}")
    set(schema_directory "${CMAKE_INSTALL_DATADIR}")
    configure_package_config_file("${PROJECT_SOURCE_DIR}/cmake/${package}Config.cmake.in"
        "${PROJECT_BINARY_DIR}/${package}Config.cmake" INSTALL_DESTINATION "${directory}" PATH_VARS schema_directory
        NO_SET_AND_CHECK_MACRO)
    write_basic_package_version_file("${PROJECT_BINARY_DIR}/${package}ConfigVersion.cmake"
        COMPATIBILITY SameMinorVersion)
    foreach(component IN LISTS ARGN)
        install(FILES "${PROJECT_BINARY_DIR}/${package}Config.cmake" "${PROJECT_BINARY_DIR}/${package}ConfigVersion.cmake"
                DESTINATION "${directory}" COMPONENT ${component})
    endforeach()
endfunction()

# krutil_install_schema(NAME DIRECTORY): the schema files of krutil_NAME.
function(krutil_install_schema name directory)
    install(DIRECTORY "${directory}/" DESTINATION "${CMAKE_INSTALL_DATADIR}/krutil_${name}/proto" COMPONENT schema
            FILES_MATCHING PATTERN "*.proto")
endfunction()

set(platform_package "")
if(KRUTIL_BUILD_PLATFORM)
    set(platform_package "krutil_platform = ${PROJECT_VERSION}, ")
    krutil_install_library(platform platform "Reference host platform of the krutil protocol"
        REQUIRES "protobuf >= 3.6" REQUIRES_PRIVATE "icu-uc"
        HEADER_DIRECTORIES "${PROJECT_SOURCE_DIR}/platform/include" "${PROJECT_BINARY_DIR}/platform/proto_generated"
        PC_VARIABLES "protodir=\${prefix}/${CMAKE_INSTALL_DATADIR}/krutil_platform/proto")
    krutil_install_config(krutil_platform platform)
    krutil_install_schema(platform "${PROJECT_SOURCE_DIR}/platform/proto")
endif()

krutil_install_library(protobuf library "${PROJECT_DESCRIPTION}"
    REQUIRES "${platform_package}protobuf >= 3.6"
    CFLAGS "-DKRUTIL_PROTOBUF_EXPORT="
    HEADER_DIRECTORIES "${PROJECT_BINARY_DIR}/proto_generated"
    PC_VARIABLES "protodir=\${prefix}/${CMAKE_INSTALL_DATADIR}/krutil_protobuf/proto"
                 "descriptor_set=\${prefix}/${CMAKE_INSTALL_DATADIR}/krutil_protobuf/krutil_protobuf.desc")
krutil_install_config(krutil_protobuf library schema tools)
krutil_install_schema(protobuf "${PROJECT_SOURCE_DIR}/src/qvm_services/krutil_protobuf/proto")
install(FILES "${PROJECT_SOURCE_DIR}/src/qvm_services/krutil_protobuf/KrutilProtocol.hpp"
        DESTINATION "${CMAKE_INSTALL_INCLUDEDIR}/krutil_protobuf" COMPONENT library)
install(FILES "${PROJECT_BINARY_DIR}/krutil_protobuf.desc"
        DESTINATION "${CMAKE_INSTALL_DATADIR}/krutil_protobuf" COMPONENT schema)

if(KRUTIL_BUILD_APPS)
    cmake_path(RELATIVE_PATH CMAKE_INSTALL_FULL_LIBDIR BASE_DIRECTORY "${CMAKE_INSTALL_FULL_BINDIR}"
               OUTPUT_VARIABLE programs_to_libraries)
    set(programs krutil_client)
    if(TARGET krutil-qvm)
        list(APPEND programs krutil-qvm)
        install(DIRECTORY "${PROJECT_SOURCE_DIR}/examples/systemd"
                DESTINATION "${CMAKE_INSTALL_DATADIR}/doc/krutil/examples" COMPONENT tools)
    endif()
    set_target_properties(${programs} PROPERTIES INSTALL_RPATH "$ORIGIN/${programs_to_libraries}")
    set_target_properties(krutil_client PROPERTIES EXPORT_NAME krutil)
    install(TARGETS ${programs} EXPORT krutil_toolsTargets RUNTIME COMPONENT tools)
    install(EXPORT krutil_toolsTargets NAMESPACE krutil:: DESTINATION "${CMAKE_INSTALL_LIBDIR}/cmake/krutil_protobuf"
            COMPONENT tools)

    install(FILES "${PROJECT_SOURCE_DIR}/apps/krutil/display/krutil-events.schema.json"
            "${PROJECT_SOURCE_DIR}/apps/krutil/inspect/krutil-inspect.schema.json"
            DESTINATION "${CMAKE_INSTALL_DATADIR}/krutil" COMPONENT tools)
    if(TARGET krutil_manuals)
        set(made "${PROJECT_BINARY_DIR}/apps/manuals/made")
        install(FILES "${made}/krutil.1" "${made}/krutil-qvm.1" DESTINATION "${CMAKE_INSTALL_MANDIR}/man1" COMPONENT tools)
        install(FILES "${made}/krutil-recording.5" DESTINATION "${CMAKE_INSTALL_MANDIR}/man5" COMPONENT tools)
        install(FILES "${made}/krutil-protocol.7" DESTINATION "${CMAKE_INSTALL_MANDIR}/man7" COMPONENT tools)
        foreach(program IN ITEMS krutil krutil-qvm)
            install(FILES "${made}/${program}.bash" RENAME "${program}"
                    DESTINATION "${CMAKE_INSTALL_DATADIR}/bash-completion/completions" COMPONENT tools)
            install(FILES "${made}/_${program}" DESTINATION "${CMAKE_INSTALL_DATADIR}/zsh/site-functions" COMPONENT tools)
            install(FILES "${made}/${program}.fish" DESTINATION "${CMAKE_INSTALL_DATADIR}/fish/vendor_completions.d"
                    COMPONENT tools)
        endforeach()
    endif()

    # Wireshark reads all schema files of that directory, and none of those below it.
    install(FILES "${PROJECT_SOURCE_DIR}/dissector/krutil.lua" DESTINATION "${CMAKE_INSTALL_LIBDIR}/wireshark/plugins"
            COMPONENT tools)
    file(GLOB schema CONFIGURE_DEPENDS "${PROJECT_SOURCE_DIR}/src/qvm_services/krutil_protobuf/proto/*.proto"
         "${PROJECT_SOURCE_DIR}/platform/proto/*.proto")
    install(FILES ${schema} DESTINATION "${CMAKE_INSTALL_DATADIR}/wireshark/protobuf" COMPONENT tools)
endif()
