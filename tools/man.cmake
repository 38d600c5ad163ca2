# A manual page per installed program, made from its --help and --version
# output by help2man at build time (skipped, with a note, without help2man).
find_program(HELP2MAN help2man)
if(NOT HELP2MAN)
    message(STATUS "help2man not found: no manual pages")
    return()
endif()
set(nxcolor_name "colour values of reflectance spectra, and sample against standard")
set(nxreg_name "read, write, import and export the NxBase registry")
set(nxmsg_name "send and receive messages between NxBase applications")
set(lumaserver_name "the measuring-device server LumaServer, emulated")
set(pages)
# Installed compressed, as Debian has manual pages (gzip -9n: no name or
# time stamp, so that a rebuild gives the same bytes).
foreach(tool nxcolor nxreg nxmsg lumaserver)
    set(page ${CMAKE_CURRENT_BINARY_DIR}/man/${tool}.1)
    add_custom_command(OUTPUT ${page}.gz
        COMMAND ${CMAKE_COMMAND} -E make_directory ${CMAKE_CURRENT_BINARY_DIR}/man
        COMMAND ${HELP2MAN} --no-info --section=1 --output=${page}
                "--name=${${tool}_name}" $<TARGET_FILE:${tool}>
        COMMAND gzip -9nkf ${page}
        DEPENDS ${tool}
        COMMENT "Manual page ${tool}.1"
        VERBATIM)
    list(APPEND pages ${page}.gz)
endforeach()
add_custom_target(manpages ALL DEPENDS ${pages})
install(FILES ${pages} DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT tools)
