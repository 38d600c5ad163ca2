# Tests: progress.
nxbase_add_test(progress_test progress_test.cpp)
