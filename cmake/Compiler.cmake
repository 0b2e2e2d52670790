# The flags that every target of the project shares, on the interface target `korvel_flags`.

set(CMAKE_CXX_STANDARD 20)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
set(CMAKE_CXX_VISIBILITY_PRESET hidden)
set(CMAKE_C_VISIBILITY_PRESET hidden)
set(CMAKE_VISIBILITY_INLINES_HIDDEN ON)
set(CMAKE_EXPORT_COMPILE_COMMANDS ON)
if(NOT CMAKE_BUILD_TYPE)
    set(CMAKE_BUILD_TYPE Release CACHE STRING "" FORCE)
endif()

find_program(CCACHE ccache)
if(CCACHE)
    set(CMAKE_C_COMPILER_LAUNCHER ${CCACHE})
    set(CMAKE_CXX_COMPILER_LAUNCHER ${CCACHE})
endif()

# Programs and libraries lie side by side, so that a build runs where it stands.
set(CMAKE_RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin)
set(CMAKE_LIBRARY_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin)

add_library(korvel_flags INTERFACE)
target_compile_options(korvel_flags INTERFACE
    -Wall -Wextra -Wshadow -Wnon-virtual-dtor -Woverloaded-virtual -Wformat=2 -Wundef -Wvla
    -Wno-unused-parameter
    -Wno-invalid-offsetof           # layout checks on classes with virtual operations
    -fno-delete-null-pointer-checks # operations that accept a null `this`
    -fno-semantic-interposition     # nobody replaces single functions of the library
    $<$<CXX_COMPILER_ID:Clang>:-Wthread-safety>
    $<$<CXX_COMPILER_ID:Clang>:-Wno-undefined-bool-conversion>
    $<$<CXX_COMPILER_ID:Clang>:-Wno-tautological-undefined-compare>
    $<$<BOOL:${KORVEL_WERROR}>:-Werror>
)
if(KORVEL_FAULTS)
    target_compile_definitions(korvel_flags INTERFACE KORVEL_FAULTS=1)
endif()
if(KORVEL_FUZZ)
    target_compile_options(korvel_flags INTERFACE -fsanitize=fuzzer-no-link)
endif()
if(KORVEL_SANITIZE)
    target_compile_options(korvel_flags INTERFACE
        -fsanitize=${KORVEL_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all
    )
    if(KORVEL_SANITIZE MATCHES "undefined")
        # Null objects are legal callees, and null is not a dereference there. The look at a callee's
        # class reads it without asking.
        target_compile_options(korvel_flags INTERFACE -fno-sanitize=null,object-size,vptr)
    endif()
    target_link_options(korvel_flags INTERFACE -fsanitize=${KORVEL_SANITIZE})
endif()
