# Debian packages, one per install component:
#   libnxbase0       the library (SONAME libnxbase.so.0) and its data
#   libnxbase-dev    headers, CMake package, nxbase.pc
#   nxbase-tools     nxcolor, nxreg, nxmsg, lumaserver and their manual pages
#   python3-nxbase   the Python module for Debian's python3
#   libnxbase-glib0, libnxbase-glib-dev, libnxbase-qt0, libnxbase-qt-dev
#                    the GLib and Qt adapters, when they are built
# Build them in a tree configured for /usr (scripts/packages.sh does):
#   cmake -B build/deb -DCMAKE_INSTALL_PREFIX=/usr ... && cd build/deb && cpack -G DEB
# dpkg-shlibdeps works out the library packages each one needs.
set(NXBASE_DEB_VERSION ${PROJECT_VERSION}-1)
set(NXBASE_PACKAGES runtime libnxbase0 dev libnxbase-dev)
if(TARGET nxcolor)
    list(APPEND NXBASE_PACKAGES tools nxbase-tools)
endif()
if(TARGET nxbase_python)
    list(APPEND NXBASE_PACKAGES python python3-nxbase)
endif()
if(TARGET nxbase-glib)
    list(APPEND NXBASE_PACKAGES glib libnxbase-glib0 glibdev libnxbase-glib-dev)
endif()
if(TARGET nxbase-qt)
    list(APPEND NXBASE_PACKAGES qt libnxbase-qt0 qtdev libnxbase-qt-dev)
endif()

# Copyright and changelog in each package's documentation directory, as
# Debian has them.
set(changelog ${PROJECT_BINARY_DIR}/packaging/changelog.Debian)
string(TIMESTAMP changelog_date "%a, %d %b %Y %H:%M:%S +0000" UTC)
file(WRITE ${changelog} "nxbase (${NXBASE_DEB_VERSION}) bookworm; urgency=medium\n\n"
     "  * Release ${PROJECT_VERSION} of NxBase for Linux.\n\n"
     " -- K-Lume NxBase developers <nxbase@k-lume.invalid>  ${changelog_date}\n")
execute_process(COMMAND gzip -9nf ${changelog})
set(NXBASE_PACKAGE_LIST "")
while(NXBASE_PACKAGES)
    list(POP_FRONT NXBASE_PACKAGES component package)
    install(FILES ${PROJECT_SOURCE_DIR}/packaging/copyright ${changelog}.gz
            DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/${package} COMPONENT ${component})
    string(TOUPPER ${component} upper)
    set(CPACK_DEBIAN_${upper}_PACKAGE_NAME ${package})
    list(APPEND NXBASE_PACKAGE_LIST ${component})
endwhile()

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME nxbase)
set(CPACK_PACKAGE_VENDOR "K-Lume")
set(CPACK_PACKAGE_CONTACT "K-Lume NxBase developers <nxbase@k-lume.invalid>")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "shared utility library of the K-Lume colour-measurement applications")
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL ${NXBASE_PACKAGE_LIST})
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_RELEASE 1)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY ">=")
# Binaries without their symbols, as Debian ships them (debuggers find them
# in a build tree), and the dynamic linker's cache renewed by dpkg's trigger
# for the three library packages (packaging/README.md says what lintian
# still notes and why).
set(CPACK_STRIP_FILES ON)
foreach(component RUNTIME GLIB QT)
    set(CPACK_DEBIAN_${component}_PACKAGE_CONTROL_EXTRA ${PROJECT_SOURCE_DIR}/packaging/triggers)
endforeach()
# The tools and the module need the library of this very build; dpkg-shlibdeps
# finds it in the library's package tree but cannot name its package.
set(CPACK_PACKAGE_DIRECTORY ${PROJECT_BINARY_DIR}/packages)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS
    ${CPACK_PACKAGE_DIRECTORY}/_CPack_Packages/Linux/DEB/nxbase-${PROJECT_VERSION}-Linux/runtime/${CMAKE_INSTALL_FULL_LIBDIR})
set(exact "libnxbase0 (= ${NXBASE_DEB_VERSION})")

set(CPACK_DEBIAN_RUNTIME_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_RUNTIME_DESCRIPTION "NxBase for Linux, the shared library
 Colour science (spectra, illuminants, observers, XYZ, CIELAB, DIN99,
 densities, screen colours), configuration, the process log, texts in many
 languages, measurement data files, progress reporting and the messaging with
 the measuring-device server LumaServer, for the K-Lume applications.")

set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "${exact}, libboost-dev (>= 1.74)")
set(CPACK_DEBIAN_DEV_DESCRIPTION "NxBase for Linux, development files
 Headers, the CMake package (find_package(NxBase)) and the pkg-config file
 nxbase.pc for building against libnxbase.")

set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION science)
set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS "${exact}")
set(CPACK_DEBIAN_TOOLS_DESCRIPTION "NxBase for Linux, command-line tools
 nxcolor (colour values of spectra), nxreg (the NxBase registry), nxmsg
 (messages between NxBase applications) and lumaserver (the measuring-device
 server, emulated).")

set(CPACK_DEBIAN_PYTHON_PACKAGE_SECTION python)
set(CPACK_DEBIAN_PYTHON_PACKAGE_DEPENDS "${exact}, python3 (>= 3.11), python3 (<< 3.12), python3-numpy")
set(CPACK_DEBIAN_PYTHON_DESCRIPTION "NxBase for Linux, Python 3 module
 The module nxbase: spectra to XYZ, CIELAB, LCh, DIN99 and densities on NumPy
 arrays, colour differences, spectral files, and a client of LumaServer.")

foreach(toolkit glib qt)
    string(TOUPPER ${toolkit} upper)
    set(CPACK_DEBIAN_${upper}_PACKAGE_SECTION libs)
    set(CPACK_DEBIAN_${upper}_PACKAGE_DEPENDS "${exact}")
    set(CPACK_DEBIAN_${upper}DEV_PACKAGE_SECTION libdevel)
endforeach()
set(CPACK_DEBIAN_GLIB_DESCRIPTION "NxBase for Linux, the GLib main-loop adapter
 Runs NxBase's event loop (messaging with LumaServer and the other
 applications) inside a GLib main loop, without polling.")
set(CPACK_DEBIAN_GLIBDEV_PACKAGE_DEPENDS
    "libnxbase-dev (= ${NXBASE_DEB_VERSION}), libnxbase-glib0 (= ${NXBASE_DEB_VERSION}), libglib2.0-dev")
set(CPACK_DEBIAN_GLIBDEV_DESCRIPTION "NxBase for Linux, the GLib main-loop adapter, development files
 Header, CMake component (find_package(NxBase COMPONENTS glib)) and
 pkg-config file nxbase-glib.pc.")
set(CPACK_DEBIAN_QT_DESCRIPTION "NxBase for Linux, the Qt 6 adapter and user interface
 Runs NxBase's event loop inside Qt's without polling, and shows the
 library's message boxes, waiting state, abort dialog and progress in Qt
 widgets.")
set(CPACK_DEBIAN_QTDEV_PACKAGE_DEPENDS
    "libnxbase-dev (= ${NXBASE_DEB_VERSION}), libnxbase-qt0 (= ${NXBASE_DEB_VERSION}), qt6-base-dev")
set(CPACK_DEBIAN_QTDEV_DESCRIPTION "NxBase for Linux, the Qt 6 adapter, development files
 Headers, CMake component (find_package(NxBase COMPONENTS qt)) and
 pkg-config file nxbase-qt.pc.")

include(CPack)
