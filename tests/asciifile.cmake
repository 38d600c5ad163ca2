# Tests: asciifile.
nxbase_add_test(asciifile_test asciifile_test.cpp)
