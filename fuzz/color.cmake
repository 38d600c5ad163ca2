# Fuzz targets: color (nxcolor's spectra reader, CSV and CGATS).
nxbase_add_fuzzer(nxcolor_spectra_fuzzer nxcolor_spectra_fuzzer.cpp)
target_sources(nxcolor_spectra_fuzzer PRIVATE
    ${PROJECT_SOURCE_DIR}/tools/nxcolor/spectra_cgats.cpp
    ${PROJECT_SOURCE_DIR}/tools/nxcolor/spectra_csv.cpp)
target_include_directories(nxcolor_spectra_fuzzer PRIVATE ${PROJECT_SOURCE_DIR}/tools/nxcolor)
pkg_check_modules(NXCOLOR_FUZZ_LCMS2 IMPORTED_TARGET lcms2)
if(NXCOLOR_FUZZ_LCMS2_FOUND)
    target_link_libraries(nxcolor_spectra_fuzzer PRIVATE PkgConfig::NXCOLOR_FUZZ_LCMS2)
    target_compile_definitions(nxcolor_spectra_fuzzer PRIVATE NXCOLOR_HAVE_LCMS2=1)
else()
    target_compile_definitions(nxcolor_spectra_fuzzer PRIVATE NXCOLOR_HAVE_LCMS2=0)
endif()
