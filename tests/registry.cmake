# Tests: registry and operating-system facts.
nxbase_add_test(registry_test registry_test.cpp)
nxbase_add_test(osinfo_test osinfo_test.cpp)
