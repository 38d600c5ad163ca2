# Tests: every C++ source follows .clang-format.
find_program(CLANG_FORMAT clang-format)
if(CLANG_FORMAT)
    add_test(NAME Format.SourcesFollowClangFormat
             COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/format/check_format.sh ${CLANG_FORMAT} ${PROJECT_SOURCE_DIR})
    set_tests_properties(Format.SourcesFollowClangFormat PROPERTIES LABELS format)
endif()
