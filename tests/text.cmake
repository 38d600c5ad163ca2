# Tests: text.
nxbase_add_test(language_test language_test.cpp)
nxbase_add_test(text_test text_test.cpp)
