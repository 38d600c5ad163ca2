# Tests: the installed package, used by a consumer through find_package and pkg-config.
add_test(NAME InstalledPackage.BuildsAndRunsAConsumer
         COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/packaging/check_install.sh
                 ${PROJECT_BINARY_DIR} ${PROJECT_SOURCE_DIR} "${CMAKE_CXX_FLAGS}")
set_tests_properties(InstalledPackage.BuildsAndRunsAConsumer PROPERTIES LABELS packaging TIMEOUT 300)

# The API reference builds from the public headers without a single Doxygen warning.
if(TARGET docs)
    add_test(NAME Docs.ApiReferenceBuildsWithoutWarnings
             COMMAND ${CMAKE_COMMAND} --build ${PROJECT_BINARY_DIR} --target docs)
    set_tests_properties(Docs.ApiReferenceBuildsWithoutWarnings PROPERTIES LABELS packaging TIMEOUT 300)
endif()
