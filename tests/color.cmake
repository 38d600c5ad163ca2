# Tests: color.
nxbase_add_test(linalg_test linalg_test.cpp)
