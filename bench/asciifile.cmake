# Benchmarks: asciifile.
nxbase_add_bench(asciifile_bench asciifile_bench.cpp)
