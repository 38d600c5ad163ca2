# Command-line programs: registry.
# nxreg: lists, reads, writes, deletes, imports and exports registry keys.
add_executable(nxreg nxreg/main.cpp)
target_link_libraries(nxreg PRIVATE nxbase)
install(TARGETS nxreg RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT tools)
