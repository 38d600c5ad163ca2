# Fuzz targets: text files.
nxbase_add_fuzzer(text_fuzz text_fuzz.cpp)
