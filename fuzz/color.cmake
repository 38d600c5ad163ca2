# Fuzz targets: color (nxcolor's CSV spectra reader).
nxbase_add_fuzzer(nxcolor_csv_fuzzer nxcolor_csv_fuzzer.cpp)
target_sources(nxcolor_csv_fuzzer PRIVATE ${PROJECT_SOURCE_DIR}/tools/nxcolor/spectra_csv.cpp)
target_include_directories(nxcolor_csv_fuzzer PRIVATE ${PROJECT_SOURCE_DIR}/tools/nxcolor)
