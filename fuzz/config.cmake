# Fuzz targets: config.
nxbase_add_fuzzer(ini_fuzz ini_fuzz.cpp)
