# How everything in this repository is compiled: language level, warnings, sanitizers, hardening.
#
# krutil_compile_options is linked privately by every target of our own; generated code takes only the language level and
# the sanitizers (krutil_generated_options), because its warnings are not ours to mend.

set(CMAKE_CXX_STANDARD 20)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
set(CMAKE_EXPORT_COMPILE_COMMANDS ON)
if(PROJECT_IS_TOP_LEVEL AND NOT CMAKE_BUILD_TYPE AND NOT CMAKE_CONFIGURATION_TYPES)
    set(CMAKE_BUILD_TYPE Release CACHE STRING "Build type" FORCE)
endif()

find_package(Threads REQUIRED)

# krutil_export_by(TARGET FILE): what a shared library exports is what FILE, a version script, says.
#
# A library that has been loaded stays. Its message classes are known to Protocol Buffers for as long as the process lives,
# so it cannot be unloaded: loaded again, it would register them a second time, which aborts.
function(krutil_export_by target file)
    target_link_options(${target} PRIVATE "LINKER:--version-script=${file}" LINKER:-z,nodelete)
    set_property(TARGET ${target} APPEND PROPERTY LINK_DEPENDS "${file}")
endfunction()

# The debug information of the libraries says what their types are, whatever the preset has for other targets: their ABI
# is read from it.
set(krutil_library_options $<$<CONFIG:RelWithDebInfo>:-g2>)
if(KRUTIL_SANITIZE)
    set(krutil_library_options "")
endif()

add_library(krutil_generated_options INTERFACE)
if(KRUTIL_SANITIZE)
    target_compile_options(krutil_generated_options INTERFACE
        -fsanitize=${KRUTIL_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
    target_link_options(krutil_generated_options INTERFACE -fsanitize=${KRUTIL_SANITIZE})
    target_compile_definitions(krutil_generated_options INTERFACE KRUTIL_SANITIZED=1)
elseif(NOT CMAKE_BUILD_TYPE STREQUAL "Debug")
    # What makes a fault harder to exploit. Functions of C that check sizes need optimised code.
    target_compile_options(krutil_generated_options INTERFACE
        -fstack-protector-strong -fstack-clash-protection -fcf-protection -U_FORTIFY_SOURCE -D_FORTIFY_SOURCE=2)
    target_link_options(krutil_generated_options INTERFACE LINKER:-z,relro LINKER:-z,now)
endif()

add_library(krutil_compile_options INTERFACE)
target_link_libraries(krutil_compile_options INTERFACE krutil_generated_options)
target_compile_options(krutil_compile_options INTERFACE -Wall -Wextra -Wconversion -Wshadow
    $<$<BOOL:${KRUTIL_WERROR}>:-Werror>)

# A source that is compiled together with others sees their names. GCC takes it for a header, too, and so a private type
# that uses an unnamed namespace for a mistake.
add_library(krutil_unity_options INTERFACE)
target_compile_options(krutil_unity_options INTERFACE
    -Wno-shadow $<$<CXX_COMPILER_ID:GNU>:-Wno-subobject-linkage>)
if(CMAKE_UNITY_BUILD)
    target_link_libraries(krutil_compile_options INTERFACE krutil_unity_options)
endif()
