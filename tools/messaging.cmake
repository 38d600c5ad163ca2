# Command-line programs: messaging.
# lumaserver: the measuring-device server emulator (reads charts as nxcolor does).
add_executable(lumaserver lumaserver/main.cpp)
target_link_libraries(lumaserver PRIVATE nxcolor_core)
install(TARGETS lumaserver RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT tools)
# nxmsg: sends one message and prints the answer, or listens and prints.
add_executable(nxmsg nxmsg/main.cpp)
target_link_libraries(nxmsg PRIVATE nxbase)
install(TARGETS nxmsg RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT tools)
