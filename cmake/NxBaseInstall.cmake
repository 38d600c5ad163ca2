include(CMakePackageConfigHelpers)

# Components, one per Debian package (cmake/NxBasePackaging.cmake): runtime
# (the library and its data), dev (headers, CMake package, pkg-config file),
# tools and python.
install(TARGETS nxbase EXPORT NxBaseTargets
    LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT runtime NAMELINK_COMPONENT dev
    ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT dev
    RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT runtime)
# The GUI adapters' headers go with their own development packages (below).
install(DIRECTORY include/nxbase DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT dev
        PATTERN "glibloop.h" EXCLUDE PATTERN "qtloop.h" EXCLUDE PATTERN "qtuserinterface.h" EXCLUDE
        PATTERN "qtspectrumview.h" EXCLUDE)
# Shipped texts, found relative to the installed library (LibraryDataDirectory).
install(DIRECTORY data/lng DESTINATION ${CMAKE_INSTALL_DATADIR}/nxbase COMPONENT runtime)
install(DIRECTORY platform/toolkit/include/toolkit DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT dev)
if(EXISTS ${PROJECT_SOURCE_DIR}/platform/cmetry/include/klume)
    install(DIRECTORY platform/cmetry/include/klume DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT dev)
endif()

set(NXBASE_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/NxBase)
install(EXPORT NxBaseTargets NAMESPACE NxBase:: DESTINATION ${NXBASE_CMAKE_DIR} COMPONENT dev)
configure_package_config_file(cmake/NxBaseConfig.cmake.in
    ${PROJECT_BINARY_DIR}/NxBaseConfig.cmake INSTALL_DESTINATION ${NXBASE_CMAKE_DIR})
write_basic_package_version_file(${PROJECT_BINARY_DIR}/NxBaseConfigVersion.cmake
    COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/NxBaseConfig.cmake
    ${PROJECT_BINARY_DIR}/NxBaseConfigVersion.cmake DESTINATION ${NXBASE_CMAKE_DIR} COMPONENT dev)

# pkg-config files name the prefix they are installed to, as a plain path
# (/usr/include, not a way back from the file's own directory): written at
# install time, when `cmake --install --prefix` may have changed it.
function(nxbase_install_pc template name component)
    set(NXBASE_PC_PREFIX "@NXBASE_PC_PREFIX@")  # kept for the install step
    configure_file(${template} ${PROJECT_BINARY_DIR}/${name}.pc.in @ONLY)
    install(CODE "set(NXBASE_PC_PREFIX \"\${CMAKE_INSTALL_PREFIX}\")
        configure_file(\"${PROJECT_BINARY_DIR}/${name}.pc.in\" \"${PROJECT_BINARY_DIR}/${name}.pc\" @ONLY)"
        COMPONENT ${component})
    install(FILES ${PROJECT_BINARY_DIR}/${name}.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig
            COMPONENT ${component})
endfunction()
nxbase_install_pc(${PROJECT_SOURCE_DIR}/cmake/nxbase.pc.in nxbase dev)

# The GUI adapters, each a library of its own with a runtime and a
# development component: find_package(NxBase COMPONENTS glib qt), or
# pkg-config nxbase-glib / nxbase-qt.
function(nxbase_install_gui component target export headers pc_name pc_requires)
    install(TARGETS ${target} EXPORT ${export}
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT ${component} NAMELINK_COMPONENT ${component}dev)
    list(TRANSFORM headers PREPEND ${PROJECT_SOURCE_DIR}/include/nxbase/)
    install(FILES ${headers} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/nxbase COMPONENT ${component}dev)
    install(EXPORT ${export} NAMESPACE NxBase:: DESTINATION ${NXBASE_CMAKE_DIR} COMPONENT ${component}dev)
    set(NXBASE_PC_NAME ${pc_name})
    set(NXBASE_PC_REQUIRES ${pc_requires})
    set(NXBASE_PC_LIB ${target})
    nxbase_install_pc(${PROJECT_SOURCE_DIR}/cmake/nxbase-gui.pc.in ${pc_name} ${component}dev)
endfunction()
if(TARGET nxbase-glib)
    nxbase_install_gui(glib nxbase-glib NxBaseGlibTargets "glibloop.h" nxbase-glib "nxbase glib-2.0")
endif()
if(TARGET nxbase-qt)
    nxbase_install_gui(qt nxbase-qt NxBaseQtTargets "qtloop.h;qtuserinterface.h;qtspectrumview.h" nxbase-qt
                       "nxbase Qt6Widgets")
endif()

# The guides and the format documents, beside the API reference: the
# installed first-hour page points to them.
install(FILES doc/first-hour.md doc/messaging.md doc/asciifile.md doc/textfile.md doc/logfile.md
              doc/memblock_format.md doc/registry.md doc/configuration.md doc/finegrid.md
        DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/libnxbase-dev COMPONENT dev)

# The API reference (target "docs", with Doxygen): the public headers and
# doc/first-hour.md as the first page; installed with the development
# package when it was built. Any Doxygen warning fails the target.
find_package(Doxygen QUIET)
find_program(Python_EXECUTABLE_FOR_DOCS NAMES python3)
if(DOXYGEN_FOUND AND Python_EXECUTABLE_FOR_DOCS)
    set(NXBASE_DOCS_DIR ${PROJECT_BINARY_DIR}/docs)
    configure_file(doc/api/Doxyfile.in ${PROJECT_BINARY_DIR}/Doxyfile @ONLY)
    add_custom_target(docs
        COMMAND ${CMAKE_COMMAND} -E remove_directory ${NXBASE_DOCS_DIR}/html
        COMMAND ${DOXYGEN_EXECUTABLE} ${PROJECT_BINARY_DIR}/Doxyfile
        WORKING_DIRECTORY ${PROJECT_BINARY_DIR}
        COMMENT "API reference in ${NXBASE_DOCS_DIR}/html"
        VERBATIM)
    install(DIRECTORY ${NXBASE_DOCS_DIR}/html DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/libnxbase-dev
            COMPONENT dev OPTIONAL)
    if(NXBASE_BUILD_TESTS)
        add_test(NAME Docs.ApiReferenceBuildsWithoutWarnings
                 COMMAND ${CMAKE_COMMAND} --build ${PROJECT_BINARY_DIR} --target docs)
        set_tests_properties(Docs.ApiReferenceBuildsWithoutWarnings PROPERTIES LABELS packaging TIMEOUT 300
                             RESOURCE_LOCK api-reference)
    endif()
endif()
