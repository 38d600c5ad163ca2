# Tests: the examples, run as a user runs them.
if(TARGET example-measure)
    add_test(NAME Examples.EveryCommandLineExampleWorks
             COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/examples/run_examples.sh ${PROJECT_BINARY_DIR} ${PROJECT_SOURCE_DIR})
    set_tests_properties(Examples.EveryCommandLineExampleWorks PROPERTIES LABELS examples TIMEOUT 120)
endif()
