# nxcolor: colour values of reflectance spectra from CSV or the built-in chart.
# The chart's CSV is embedded at configure time (editing it re-runs configure).
set(NXCOLOR_CHART_NAME colorchecker_babelcolor_average.csv)
set(NXCOLOR_CHART ${CMAKE_CURRENT_SOURCE_DIR}/nxcolor/data/${NXCOLOR_CHART_NAME})
set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS ${NXCOLOR_CHART})
file(READ ${NXCOLOR_CHART} NXCOLOR_CHART_TEXT)
if(NXCOLOR_CHART_TEXT MATCHES "\\)nxchart\"")
    message(FATAL_ERROR "${NXCOLOR_CHART}: contains the raw-string delimiter )nxchart\"")
endif()
configure_file(nxcolor/embedded_chart.cpp.in ${CMAKE_CURRENT_BINARY_DIR}/generated/nxcolor_embedded_chart.cpp @ONLY)

# The reader and the report are a library of their own so that tests reach them.
add_library(nxcolor_core STATIC
    nxcolor/compare.cpp
    nxcolor/measure.cpp
    nxcolor/report.cpp
    nxcolor/screen.cpp
    ${CMAKE_CURRENT_BINARY_DIR}/generated/nxcolor_embedded_chart.cpp)
target_include_directories(nxcolor_core PUBLIC ${CMAKE_CURRENT_SOURCE_DIR}/nxcolor)
target_link_libraries(nxcolor_core PUBLIC nxbase)

add_executable(nxcolor nxcolor/main.cpp)
target_link_libraries(nxcolor PRIVATE nxcolor_core)
install(TARGETS nxcolor RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT tools)
