# Tests: registry and operating-system facts.
nxbase_add_test(registry_test registry_test.cpp)
nxbase_add_test(osinfo_test osinfo_test.cpp)
if(TARGET nxreg)
    nxbase_add_test(nxreg_test nxreg_test.cpp)
    add_dependencies(nxreg_test nxreg)
endif()
