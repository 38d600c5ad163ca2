# Fuzz targets: memory block readers.
nxbase_add_fuzzer(memblock_fuzz memblock_fuzz.cpp)
