# nxbase_add_test(<name> <sources...> [LABELS <labels...>])
# One GoogleTest executable per family, registered with ctest.
set(NXBASE_TEST_TMPDIR ${PROJECT_BINARY_DIR}/test-tmp)
file(MAKE_DIRECTORY ${NXBASE_TEST_TMPDIR})

function(nxbase_add_test name)
    cmake_parse_arguments(ARG "" "" "LABELS;LIBS" ${ARGN})
    add_executable(${name} ${ARG_UNPARSED_ARGUMENTS})
    target_link_libraries(${name} PRIVATE nxbase GTest::gtest GTest::gmock GTest::gtest_main ${ARG_LIBS})
    target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR}/tests)
    target_compile_definitions(${name} PRIVATE
        NXBASE_TEST_DATA_DIR="${PROJECT_SOURCE_DIR}/tests/data"
        NXBASE_SOURCE_DIR="${PROJECT_SOURCE_DIR}"
        NXBASE_BINARY_DIR="${PROJECT_BINARY_DIR}")
    # Tests keep their scratch files under the build tree, never in the
    # shared /tmp.
    set(properties ENVIRONMENT "TMPDIR=${NXBASE_TEST_TMPDIR}")
    if(ARG_LABELS)
        list(APPEND properties LABELS "${ARG_LABELS}")
    endif()
    if(TARGET nxtest_launcher)
        # CMake before 3.29 runs tests through the emulator, later ones
        # through the launcher.
        add_dependencies(${name} nxtest_launcher)
        set_target_properties(${name} PROPERTIES
            CROSSCOMPILING_EMULATOR ${NXBASE_TEST_LAUNCHER}
            TEST_LAUNCHER ${NXBASE_TEST_LAUNCHER})
    endif()
    gtest_discover_tests(${name} DISCOVERY_TIMEOUT 60 PROPERTIES ${properties})
endfunction()

# nxbase_add_bench(<name> <sources...>)
function(nxbase_add_bench name)
    add_executable(${name} ${ARGN})
    target_link_libraries(${name} PRIVATE nxbase benchmark::benchmark)
    target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR}/tests)
endfunction()

# nxbase_add_fuzzer(<name> <source>)
# With clang: a libFuzzer target. Otherwise the same entry point linked to a
# driver that replays the files named on its command line, so that the seed
# corpus runs in every test pass.
function(nxbase_add_fuzzer name source)
    add_executable(${name} ${source})
    target_link_libraries(${name} PRIVATE nxbase)
    if(CMAKE_CXX_COMPILER_ID MATCHES "Clang" AND NXBASE_LIBFUZZER)
        target_compile_options(${name} PRIVATE -fsanitize=fuzzer)
        target_link_options(${name} PRIVATE -fsanitize=fuzzer)
    else()
        target_sources(${name} PRIVATE ${PROJECT_SOURCE_DIR}/fuzz/replay_main.cpp)
    endif()
    set(corpus ${PROJECT_SOURCE_DIR}/fuzz/corpus/${name})
    if(NXBASE_BUILD_TESTS AND EXISTS ${corpus})
        add_test(NAME ${name}.replay COMMAND ${name} ${corpus})
        set_tests_properties(${name}.replay PROPERTIES LABELS fuzz-replay
            ENVIRONMENT "TMPDIR=${NXBASE_TEST_TMPDIR}")
    endif()
endfunction()
