# Tests: memory block, flag set and string helpers.
nxbase_add_test(mymemblo_test mymemblo_test.cpp)
nxbase_add_test(strhelp_test strhelp_test.cpp)
