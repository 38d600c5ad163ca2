# Tests: foundation and toolkit.
nxbase_add_test(string_test string_test.cpp)
nxbase_add_test(fileio_test fileio_test.cpp)
nxbase_add_test(logfile_test logfile_test.cpp)
nxbase_add_test(singleton_test singleton_test.cpp)
nxbase_add_test(check_test check_test.cpp)
nxbase_add_test(thread_test thread_test.cpp)
nxbase_add_test(plotaxis_test plotaxis_test.cpp)
