# Benchmarks: foundation.
nxbase_add_bench(logfile_bench logfile_bench.cpp)
