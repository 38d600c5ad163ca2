# nxbase_add_family(<family> HEADERS <headers of include/nxbase...>
#                   SOURCES <sources...> [DEPENDS <families below it...>]
#                   [PUBLIC_INCLUDE <directory>] [LIBS <private libraries...>])
#
# One family of the library as an object library. Its sources see only its
# own public headers and, through DEPENDS, those of the families below it:
# each family's headers are linked into a directory of their own in the
# build tree, so that including a header of a family above (or beside) fails
# to compile. The objects go into the one shared library `nxbase`, whose
# users see every header through include/.
function(nxbase_add_family family)
    cmake_parse_arguments(F "" "PUBLIC_INCLUDE" "HEADERS;SOURCES;DEPENDS;LIBS" ${ARGN})
    set(target nxbase_${family})
    set(headers ${PROJECT_BINARY_DIR}/family-include/${family})
    file(REMOVE_RECURSE ${headers})
    file(MAKE_DIRECTORY ${headers}/nxbase)
    foreach(header ${F_HEADERS})
        if(NOT EXISTS ${PROJECT_SOURCE_DIR}/include/nxbase/${header})
            message(FATAL_ERROR "family ${family}: no header include/nxbase/${header}")
        endif()
        file(CREATE_LINK ${PROJECT_SOURCE_DIR}/include/nxbase/${header} ${headers}/nxbase/${header} SYMBOLIC)
    endforeach()
    if(F_SOURCES)
        add_library(${target} OBJECT ${F_SOURCES})
        set(scope PUBLIC)
        target_compile_definitions(${target} PRIVATE NXBASE_BUILDING_LIBRARY)
        # Calls between the library's own exported functions go direct (and
        # may be inlined) instead of through the PLT: nobody interposes them.
        target_compile_options(${target} PRIVATE -fno-semantic-interposition)
        target_link_libraries(${target} PRIVATE ${F_LIBS})
        target_link_libraries(nxbase PRIVATE ${target})
    else()
        add_library(${target} INTERFACE)
        set(scope INTERFACE)
    endif()
    target_include_directories(${target} ${scope} ${headers})
    if(F_PUBLIC_INCLUDE)
        target_include_directories(${target} ${scope} ${F_PUBLIC_INCLUDE})
    endif()
    foreach(below ${F_DEPENDS})
        target_link_libraries(${target} ${scope} nxbase_${below})
    endforeach()
    set_property(GLOBAL APPEND PROPERTY NXBASE_FAMILIES ${family})
    set_property(GLOBAL PROPERTY NXBASE_FAMILY_DEPENDS_${family} ${F_DEPENDS})
    set_property(GLOBAL PROPERTY NXBASE_FAMILY_HEADERS_${family} ${headers})
endfunction()

# Kernels built once per x86-64 instruction set, with GCC: AVX2 with
# x86-64-v3, AVX512 with AVX-512 F, DQ and VL besides (and AVX512_OPTIONS),
# both without fused multiply-adds, so that every set rounds alike, unless
# FUSED_MULTIPLY_ADD is given (faster, the last bits differ by set); the
# DISPATCHER source is compiled with DEFINE set and picks among them at run
# time. Elsewhere nothing is added and the dispatcher uses its own code.
function(nxbase_add_x86_kernels target)
    cmake_parse_arguments(K "FUSED_MULTIPLY_ADD" "AVX2;AVX512;DISPATCHER;DEFINE" "AVX512_OPTIONS" ${ARGN})
    if(NOT (CMAKE_SYSTEM_PROCESSOR MATCHES "x86_64|AMD64" AND CMAKE_CXX_COMPILER_ID STREQUAL "GNU"))
        return()
    endif()
    target_sources(${target} PRIVATE ${K_AVX2} ${K_AVX512})
    set(contract "-ffp-contract=off")
    if(K_FUSED_MULTIPLY_ADD)
        set(contract "-ffp-contract=fast")
    endif()
    set_source_files_properties(${K_AVX2} PROPERTIES COMPILE_OPTIONS "${contract};-march=x86-64-v3")
    set_source_files_properties(${K_AVX512} PROPERTIES COMPILE_OPTIONS
        "${contract};-march=x86-64-v3;-mavx512f;-mavx512dq;-mavx512vl;${K_AVX512_OPTIONS}")
    set_source_files_properties(${K_DISPATCHER} PROPERTIES COMPILE_DEFINITIONS ${K_DEFINE})
endfunction()
