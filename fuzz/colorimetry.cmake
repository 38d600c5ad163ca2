# Fuzz targets: colorimetry (installed table reader).
nxbase_add_fuzzer(cmetry_csv_fuzzer cmetry_csv_fuzzer.cpp)
target_include_directories(cmetry_csv_fuzzer PRIVATE ${PROJECT_SOURCE_DIR}/platform/cmetry)
