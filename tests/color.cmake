# Tests: color.
nxbase_add_test(linalg_test linalg_test.cpp)
nxbase_add_test(colorvector_test colorvector_test.cpp)
nxbase_add_test(colorbatch_test colorbatch_test.cpp)
