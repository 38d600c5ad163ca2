# Tests: the event loop and messaging.
nxbase_add_test(application_test application_test.cpp)
nxbase_add_test(msgcat_test msgcat_test.cpp)
add_executable(pipe_peer integration/pipe_peer.cpp)
target_link_libraries(pipe_peer PRIVATE nxbase)
nxbase_add_test(pipe_test pipe_test.cpp)
add_dependencies(pipe_test pipe_peer)
target_compile_definitions(pipe_test PRIVATE NXBASE_PIPE_PEER="$<TARGET_FILE:pipe_peer>")
