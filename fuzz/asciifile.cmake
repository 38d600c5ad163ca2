# Fuzz targets: asciifile.
nxbase_add_fuzzer(asciifile_fuzz asciifile_fuzz.cpp)
