# Fuzz targets: registry.
nxbase_add_fuzzer(regedit_fuzz regedit_fuzz.cpp)
