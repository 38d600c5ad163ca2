# nxdemo: the foundation at work (threads, keyed lines, nested blocks).
add_executable(nxdemo nxdemo/main.cpp)
target_link_libraries(nxdemo PRIVATE nxbase)
