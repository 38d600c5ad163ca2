# Tests: the installed package, used by a consumer through find_package and pkg-config.
add_test(NAME InstalledPackage.BuildsAndRunsAConsumer
         COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/packaging/check_install.sh
                 ${PROJECT_BINARY_DIR} ${PROJECT_SOURCE_DIR} "${CMAKE_CXX_FLAGS}")
# The API reference test rebuilds docs/html, which the installation copies.
set_tests_properties(InstalledPackage.BuildsAndRunsAConsumer PROPERTIES LABELS packaging TIMEOUT 300
                     RESOURCE_LOCK api-reference)

